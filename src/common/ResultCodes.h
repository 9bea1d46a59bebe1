// Names of the transaction result codes, as message traces report them.
#pragma once

#include <cstdint>
#include <string>

namespace vtc {

// "kNBSuccess", "kNBNetworkError", ... or the code's decimal text.
std::string resultCodeName(int32_t code);

}  // namespace vtc
