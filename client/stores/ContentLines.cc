#include "client/stores/ContentLines.h"

namespace vtc::client {

namespace {

constexpr size_t kMaximumLineOctets = 75;  // without the CRLF

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

bool isUtf8Continuation(char c) {
  return (static_cast<unsigned char>(c) & 0xC0) == 0x80;
}

// Appends one physical line, folded so that no line exceeds the limit; a
// fold goes before the start of a UTF-8 sequence.
void appendFolded(std::string& out, std::string_view line) {
  size_t room = kMaximumLineOctets;
  while (line.size() > room) {
    size_t cut = room;
    while (cut > 0 && isUtf8Continuation(line[cut])) --cut;
    if (cut == 0) cut = room;  // not UTF-8: any cut keeps the bytes
    out.append(line.substr(0, cut));
    out.append("\r\n ");
    line.remove_prefix(cut);
    room = kMaximumLineOctets - 1;  // the leading space counts
  }
  out.append(line);
  out.append("\r\n");
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

}  // namespace

std::vector<ContentLine> readContentLines(std::string_view bytes) {
  std::vector<ContentLine> lines;
  size_t pos = 0;
  while (pos < bytes.size()) {
    PhysicalLine first = physicalLineAt(bytes, pos);
    ContentLine line;
    line.plain = first.content;
    size_t next = first.next;
    while (next < bytes.size() && (bytes[next] == ' ' || bytes[next] == '\t')) {
      PhysicalLine more = physicalLineAt(bytes, next);
      if (!line.folded) line.unfolded.assign(line.plain);
      line.folded = true;
      line.unfolded.append(more.content.substr(1));
      next = more.next;
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

std::string upperCase(std::string_view s) {
  std::string out(s);
  for (char& c : out)
    if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
  return out;
}

void appendConformingLines(std::string& out, std::string_view raw) {
  size_t pos = 0;
  while (pos < raw.size()) {
    PhysicalLine line = physicalLineAt(raw, pos);
    appendFolded(out, line.content);
    pos = line.next;
  }
}

}  // namespace vtc::client
