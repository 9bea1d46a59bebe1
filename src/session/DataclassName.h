// What a dataclass may be called. A name becomes one component of the
// share's paths, the name of a local folder, the end of preference keys and
// a level of a push topic, so it is a plain name: ASCII letters, digits,
// '.', '_' and '-', not starting with '.', without "..", and at most
// kMaxDataclassNameLength characters. Names from the command line, the
// preferences and the share are all checked against this.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace vtc {

inline constexpr size_t kMaxDataclassNameLength = 100;

// Empty when the name is plain; else why it is not, as the end of a
// sentence ("it contains the character '/'"), with unprintable bytes
// written as \xNN.
std::string dataclassNameProblem(std::string_view name);
inline bool isPlainDataclassName(std::string_view name) {
  return dataclassNameProblem(name).empty();
}
// Raises std::invalid_argument, saying why, when the name is not plain.
void requirePlainDataclassName(std::string_view name);

}  // namespace vtc
