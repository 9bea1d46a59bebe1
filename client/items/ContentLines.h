// Content lines of vCard and iCalendar text, read at the level of octets:
// cutting bytes into logical lines (a line with its folded continuations),
// and reading a line's name, parameters and value. Nothing here interprets
// UTF-8, so a fold that a writer put inside a multi-octet character is
// joined back into that character, never replaced.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace vtc::client {

struct ContentLine {
  // The line's exact bytes: its physical lines with their line ends.
  std::string_view raw;
  // The line unfolded, without line end: a fold (a line end and the space
  // or tab after it) is removed, and so is a quoted-printable soft line
  // break ("=" at a line end) of a vCard 2.1 value.
  std::string_view text() const { return joined ? std::string_view(unfolded) : plain; }
  bool blank() const { return text().find_first_not_of(" \t") == std::string_view::npos; }

  std::string_view plain;  // the text of a line of one physical line, a view into `raw`
  std::string unfolded;    // the text of a line of several, put together
  bool joined = false;
};

// Cuts bytes into logical lines. A line ends at LF or CRLF (a last line
// without an end is taken as it is); a physical line that starts with a
// space or tab continues the line before it, as does the line after one
// that ends in "=" inside a quoted-printable value. Never fails: what the
// lines mean is for the caller to judge.
std::vector<ContentLine> readContentLines(std::string_view bytes);

// The property name of an unfolded line (the part before the first ';' or
// ':'), or empty when the line is no content line: the name has characters
// other than letters, digits, '-', '_' and '.', or no ':' follows it.
std::string_view lineName(std::string_view text);

// The value of an unfolded content line: what follows the first ':' that is
// not inside a quoted parameter value.
std::string_view lineValue(std::string_view text);

// The parameters between the name and the value's ':', as written
// (";TYPE=work;PREF=1"), empty when there are none.
std::string_view lineParameters(std::string_view text);

struct Parameter {
  std::string_view name;   // empty for a vCard 2.1 bare value ("TEL;WORK:")
  std::string_view value;  // as written, quotes included
};
// The parameters of a line, in order.
std::vector<Parameter> splitParameters(std::string_view parameters);

// ASCII upper and lower case.
std::string upperCase(std::string_view s);
std::string lowerCase(std::string_view s);
bool equalsIgnoringCase(std::string_view a, std::string_view b);

// Whether a line's parameters say its value is quoted-printable
// ("ENCODING=QUOTED-PRINTABLE", or the bare 2.1 form).
bool isQuotedPrintable(std::string_view text);

}  // namespace vtc::client
