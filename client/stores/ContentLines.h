// Content lines of vCard and iCalendar text: cutting bytes into logical lines
// (a line with its folded continuations), reading a line's name and value,
// and writing lines the way the formats require (CRLF ends, folding at 75
// octets, never inside a UTF-8 sequence).
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace vtc::client {

struct ContentLine {
  // The line's exact bytes: its physical lines with their line ends.
  std::string_view raw;
  // The line unfolded, without line end.
  std::string_view text() const { return folded ? std::string_view(unfolded) : plain; }
  bool blank() const { return text().find_first_not_of(" \t") == std::string_view::npos; }

  std::string_view plain;  // an unfolded line's text, a view into `raw`
  std::string unfolded;    // a folded line's text, put together
  bool folded = false;
};

// Cuts bytes into logical lines. A line ends at LF or CRLF (a last line
// without an end is taken as it is); a physical line that starts with a
// space or tab continues the line before it. Never fails: what the lines
// mean is for the caller to judge.
std::vector<ContentLine> readContentLines(std::string_view bytes);

// The property name of an unfolded line (the part before the first ';' or
// ':'), or empty when the line is no content line: the name has characters
// other than letters, digits, '-', '_' and '.', or no ':' follows it.
std::string_view lineName(std::string_view text);

// The value of an unfolded content line: what follows the first ':' that is
// not inside a quoted parameter value.
std::string_view lineValue(std::string_view text);

// ASCII upper case.
std::string upperCase(std::string_view s);

// Appends raw line bytes as the formats want them: every line ending in
// CRLF (bare LF or a missing end become CRLF) and physical lines longer
// than 75 octets folded. Lines that already conform are copied unchanged,
// so the result of a second pass equals the first.
void appendConformingLines(std::string& out, std::string_view raw);

}  // namespace vtc::client
