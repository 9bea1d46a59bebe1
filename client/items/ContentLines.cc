#include "client/items/ContentLines.h"

namespace vtc::client {

namespace {

// One physical line: its bytes without the line end, and where the next begins.
struct PhysicalLine {
  std::string_view content;
  size_t next;
};

PhysicalLine physicalLineAt(std::string_view bytes, size_t start) {
  size_t lf = bytes.find('\n', start);
  size_t end = lf == std::string_view::npos ? bytes.size() : lf;
  size_t next = lf == std::string_view::npos ? bytes.size() : lf + 1;
  if (end > start && bytes[end - 1] == '\r') --end;
  return {bytes.substr(start, end - start), next};
}

bool isNameCharacter(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' ||
         c == '_' || c == '.';
}

// Where the value's ':' is, or npos. Parameter values may quote a ':'; a
// line whose quotes do not pair up is read at its first ':'.
size_t valueColon(std::string_view text) {
  bool quoted = false;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '"')
      quoted = !quoted;
    else if (text[i] == ':' && !quoted)
      return i;
  }
  return text.find(':');
}

// A quoted-printable line continues on the next physical line when it ends
// in a soft line break; "==" at the end is an encoded "=" and then a break.
bool endsInSoftBreak(std::string_view content) {
  return !content.empty() && content.back() == '=';
}

}  // namespace

std::vector<ContentLine> readContentLines(std::string_view bytes) {
  std::vector<ContentLine> lines;
  size_t pos = 0;
  while (pos < bytes.size()) {
    PhysicalLine first = physicalLineAt(bytes, pos);
    ContentLine line;
    line.plain = first.content;
    size_t next = first.next;
    const bool quotedPrintable = isQuotedPrintable(first.content);
    std::string_view last = first.content;
    auto join = [&](std::string_view more) {
      if (!line.joined) line.unfolded.assign(line.plain);
      line.joined = true;
      line.unfolded.append(more);
    };
    while (next < bytes.size()) {
      if (bytes[next] == ' ' || bytes[next] == '\t') {
        PhysicalLine more = physicalLineAt(bytes, next);
        join(more.content.substr(1));
        last = more.content;
        next = more.next;
      } else if (quotedPrintable && endsInSoftBreak(last)) {
        // The soft break's "=" goes; the next physical line goes on the value.
        PhysicalLine more = physicalLineAt(bytes, next);
        join({});
        line.unfolded.pop_back();
        line.unfolded.append(more.content);
        last = more.content;
        next = more.next;
      } else {
        break;
      }
    }
    line.raw = bytes.substr(pos, next - pos);
    lines.push_back(std::move(line));
    pos = next;
  }
  return lines;
}

std::string_view lineName(std::string_view text) {
  size_t end = 0;
  while (end < text.size() && isNameCharacter(text[end])) ++end;
  if (end == 0 || end == text.size() || (text[end] != ':' && text[end] != ';')) return {};
  if (valueColon(text) == std::string_view::npos) return {};
  return text.substr(0, end);
}

std::string_view lineValue(std::string_view text) {
  size_t colon = valueColon(text);
  return colon == std::string_view::npos ? std::string_view() : text.substr(colon + 1);
}

std::string_view lineParameters(std::string_view text) {
  size_t colon = valueColon(text);
  if (colon == std::string_view::npos) return {};
  size_t semicolon = text.find(';');
  if (semicolon == std::string_view::npos || semicolon > colon) return {};
  return text.substr(semicolon, colon - semicolon);
}

std::vector<Parameter> splitParameters(std::string_view parameters) {
  std::vector<Parameter> out;
  size_t i = 0;
  while (i < parameters.size()) {
    if (parameters[i] != ';') {
      ++i;
      continue;
    }
    size_t start = ++i;
    bool quoted = false;
    while (i < parameters.size() && (quoted || parameters[i] != ';')) {
      if (parameters[i] == '"') quoted = !quoted;
      ++i;
    }
    std::string_view piece = parameters.substr(start, i - start);
    size_t eq = piece.find('=');
    if (eq == std::string_view::npos)
      out.push_back({{}, piece});
    else
      out.push_back({piece.substr(0, eq), piece.substr(eq + 1)});
  }
  return out;
}

std::string upperCase(std::string_view s) {
  std::string out(s);
  for (char& c : out)
    if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
  return out;
}

std::string lowerCase(std::string_view s) {
  std::string out(s);
  for (char& c : out)
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  return out;
}

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) return false;
  for (size_t i = 0; i < a.size(); ++i) {
    char x = a[i], y = b[i];
    if (x >= 'a' && x <= 'z') x = static_cast<char>(x - 'a' + 'A');
    if (y >= 'a' && y <= 'z') y = static_cast<char>(y - 'a' + 'A');
    if (x != y) return false;
  }
  return true;
}

bool isQuotedPrintable(std::string_view text) {
  // Cheap test first: most lines have no parameters at all.
  const size_t colon = text.find(':');
  const size_t semicolon = text.find(';');
  if (semicolon == std::string_view::npos || semicolon > colon) return false;
  for (const Parameter& p : splitParameters(text.substr(semicolon, colon - semicolon)))
    if (equalsIgnoringCase(p.value, "QUOTED-PRINTABLE") &&
        (p.name.empty() || equalsIgnoringCase(p.name, "ENCODING")))
      return true;
  return false;
}

}  // namespace vtc::client
