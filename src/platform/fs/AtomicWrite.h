// Whole-file writes that readers never see half done.
#pragma once

#include <string>
#include <string_view>

namespace vtc::fs {

// Writes bytes to a temporary file beside path, flushes it and renames it
// over path. On failure path is unchanged and false is returned.
bool writeFileAtomically(const std::string& path, std::string_view bytes, int mode = 0644);

}  // namespace vtc::fs
