// Text from the share or another computer shown on a terminal: its control
// characters (C0, DEL, C1), the characters that reorder or hide text (the
// bidirectional and zero-width format characters) and bytes that are no
// UTF-8 are written as escapes ("\x1b", "\u202e"), so that no value can move
// the cursor, change colours or the window title, or disguise what follows.
#pragma once

#include <string>
#include <string_view>

namespace vtc::client {

std::string shownSafely(std::string_view text);

}  // namespace vtc::client
