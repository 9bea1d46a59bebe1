#include "client/items/ItemText.h"

#include <algorithm>
#include <map>
#include <set>

#include "client/items/ContentLines.h"
#include "common/Format.h"

namespace vtc::client {

namespace {

using Role = ItemUnit::Role;

constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";

// The word after BEGIN: or END:, upper case, without surrounding blanks.
std::string componentName(std::string_view text) {
  std::string_view value = lineValue(text);
  while (!value.empty() && (value.back() == ' ' || value.back() == '\t')) value.remove_suffix(1);
  while (!value.empty() && (value.front() == ' ' || value.front() == '\t')) value.remove_prefix(1);
  return upperCase(value);
}

std::string trimmed(std::string_view s) {
  size_t b = s.find_first_not_of(" \t");
  if (b == std::string_view::npos) return {};
  size_t e = s.find_last_not_of(" \t");
  return std::string(s.substr(b, e - b + 1));
}

class TextReader {
 public:
  TextReader(ItemKind kind, std::string_view bytes) : kind_(kind), bytes_(bytes) {
    std::string_view rest = bytes;
    if (rest.starts_with(kByteOrderMark)) rest.remove_prefix(kByteOrderMark.size());
    lines_ = readContentLines(rest);
    pending_ = bytes.data();
  }

  std::optional<ItemText> read(std::string* problem) {
    bool ok = kind_ == ItemKind::Contacts ? readCard() : readCalendar();
    if (!ok) {
      if (problem) *problem = problem_;
      return std::nullopt;
    }
    return std::move(text_);
  }

 private:
  ItemKind kind_;
  std::string_view bytes_;
  std::vector<ContentLine> lines_;
  size_t next_ = 0;
  const char* pending_;  // where the next unit's bytes begin
  ItemText text_;
  std::string problem_;
  std::set<std::string> scopes_;

  bool fail(std::string problem) {
    problem_ = std::move(problem);
    return false;
  }
  // The physical line number of a logical line, for messages.
  size_t lineNumber(size_t index) const {
    const char* at = lines_[index].raw.data();
    return 1 + static_cast<size_t>(std::count(bytes_.data(), at, '\n'));
  }
  bool failAtLine(size_t index, const char* what) {
    return fail(format("line %zu %s", lineNumber(index), what));
  }

  std::string_view text(size_t index) const { return lines_[index].text(); }
  const char* endOf(size_t index) const {
    return lines_[index].raw.data() + lines_[index].raw.size();
  }
  // The upper-case name of a content line; false (with the problem set) for
  // a line that is no content line.
  bool nameOf(size_t index, std::string* name) {
    std::string_view n = lineName(text(index));
    if (n.empty()) return failAtLine(index, "is not a content line");
    *name = upperCase(n);
    return true;
  }

  // A unit from the pending bytes (blank lines, the byte order mark) up to end.
  void emit(Role role, const std::string& scope, std::string name, const char* end) {
    text_.units.push_back({role, std::string_view(pending_, static_cast<size_t>(end - pending_)),
                           scope, std::move(name)});
    pending_ = end;
  }

  void skipBlank() {
    while (next_ < lines_.size() && lines_[next_].blank()) ++next_;
  }

  // BEGIN:<what> after any blank lines.
  bool readBegin(const char* what) {
    skipBlank();
    std::string name;
    if (next_ == lines_.size()) return fail(format("there is no BEGIN:%s", what));
    if (!nameOf(next_, &name)) return false;
    if (name != "BEGIN" || componentName(text(next_)) != what)
      return fail(format("it does not start with BEGIN:%s", what));
    emit(Role::Frame, "", kBegin, endOf(next_++));
    return true;
  }

  // END:<what> at next_, then only blank lines to the end of the bytes.
  bool readEnd(const char* what) {
    for (size_t i = next_ + 1; i < lines_.size(); ++i)
      if (!lines_[i].blank()) return fail(format("there is more after END:%s", what));
    next_ = lines_.size();
    emit(Role::Frame, "", kEnd, bytes_.data() + bytes_.size());
    return true;
  }

  // The END line that closes the BEGIN at begin.
  bool blockEnd(size_t begin, size_t* end) {
    std::vector<std::string> open;
    std::string name;
    for (size_t i = begin; i < lines_.size(); ++i) {
      if (lines_[i].blank()) continue;
      if (!nameOf(i, &name)) return false;
      if (name == "BEGIN") {
        open.push_back(componentName(text(i)));
        if (open.back() == "VCALENDAR" && i != begin)
          return failAtLine(i, "begins a calendar inside another");
      } else if (name == "END") {
        if (open.empty() || componentName(text(i)) != open.back())
          return failAtLine(i, "ends another component");
        open.pop_back();
        if (open.empty()) {
          *end = i;
          return true;
        }
      }
    }
    return fail(format("BEGIN:%@ has no END", open.empty() ? std::string("?") : open.front()));
  }

  bool readCard() {
    if (!readBegin("VCARD")) return false;
    for (std::string name; next_ < lines_.size(); ++next_) {
      if (lines_[next_].blank()) continue;
      if (!nameOf(next_, &name)) return false;
      if (name == "BEGIN") return failAtLine(next_, "begins a component inside the vCard");
      if (name == "END") {
        if (componentName(text(next_)) != "VCARD") return failAtLine(next_, "ends no vCard");
        return readEnd("VCARD");
      }
      if (name == "AGENT" && readAgentCard()) continue;
      if (!problem_.empty()) return false;
      if (name == "UID" && text_.uid.empty()) text_.uid = trimmed(lineValue(text(next_)));
      emit(Role::Property, "", std::move(name), endOf(next_));
    }
    return fail("there is no END:VCARD");
  }

  // A vCard 2.1 agent given as a card of its own: "AGENT:" and the card's
  // lines after it, or "AGENT:BEGIN:VCARD" and the rest. The whole is one
  // unit. False with no problem set: an agent given as a value.
  bool readAgentCard() {
    const std::string value = upperCase(trimmed(lineValue(text(next_))));
    size_t begin = next_ + 1;
    if (value.empty()) {
      while (begin < lines_.size() && lines_[begin].blank()) ++begin;
      std::string name;
      if (begin == lines_.size() || upperCase(lineName(text(begin))) != "BEGIN" ||
          componentName(text(begin)) != "VCARD")
        return false;
    } else if (value != "BEGIN:VCARD") {
      return false;
    }
    size_t depth = value.empty() ? 0 : 1;
    for (size_t i = begin; i < lines_.size(); ++i) {
      if (lines_[i].blank()) continue;
      std::string name;
      if (!nameOf(i, &name)) return false;
      if (name == "BEGIN") ++depth;
      if (name == "END" && --depth == 0) {
        emit(Role::Block, "", "AGENT", endOf(i));
        next_ = i;
        return true;
      }
    }
    return fail("an AGENT card has no END:VCARD");
  }

  bool readCalendar() {
    if (!readBegin("VCALENDAR")) return false;
    for (std::string name; next_ < lines_.size();) {
      if (lines_[next_].blank()) {
        ++next_;
        continue;
      }
      if (!nameOf(next_, &name)) return false;
      if (name == "END") {
        if (componentName(text(next_)) != "VCALENDAR") return failAtLine(next_, "ends nothing");
        return readEnd("VCALENDAR");
      }
      if (name == "BEGIN") {
        if (!readComponent()) return false;
        continue;
      }
      emit(Role::Property, "", std::move(name), endOf(next_++));
    }
    return fail("there is no END:VCALENDAR");
  }

  // A component at the calendar's level, BEGIN to END: a time zone whole,
  // or an event, to-do or journal entry cut into its frame, properties and
  // nested components, named by its UID and RECURRENCE-ID.
  bool readComponent() {
    size_t begin = next_, end = 0;
    if (!blockEnd(begin, &end)) return false;
    next_ = end + 1;
    const std::string kind = componentName(text(begin));
    if (kind == "VCALENDAR") return failAtLine(begin, "begins a calendar inside another");
    if (kind == "VTIMEZONE") return readTimeZone(begin, end);

    // Its name first: every unit carries it.
    std::optional<std::string> uid, recurrenceId;
    std::string name;
    for (size_t i = begin + 1, depth = 0; i < end; ++i) {
      if (lines_[i].blank()) continue;
      nameOf(i, &name);  // blockEnd has checked every line
      if (name == "BEGIN") ++depth;
      if (name == "END") --depth;
      if (depth != 0 || (name != "UID" && name != "RECURRENCE-ID")) continue;
      auto& slot = name == "UID" ? uid : recurrenceId;
      if (slot) return failAtLine(i, "repeats a property that names the component");
      slot = trimmed(lineValue(text(i)));
    }
    // "<kind>/<recurrence-id>/<uid>": a recurrence id never holds a "/", a UID may.
    std::string scope = kind + '/' + recurrenceId.value_or("") + '/';
    if (uid && !uid->empty()) {
      scope += *uid;
      if (text_.uid.empty()) text_.uid = *uid;
    } else {
      scope += "#" + std::to_string(++unnamed_[kind]);
    }
    if (!scopes_.insert(scope).second) return fail(format("%@ is there twice", scope));

    emit(Role::Frame, scope, kBegin, endOf(begin));
    for (size_t i = begin + 1; i < end; ++i) {
      if (lines_[i].blank()) continue;
      nameOf(i, &name);
      if (name == "BEGIN") {
        size_t nestedEnd = 0;
        blockEnd(i, &nestedEnd);
        emit(Role::Block, scope, componentName(text(i)), endOf(nestedEnd));
        i = nestedEnd;
        continue;
      }
      emit(Role::Property, scope, std::move(name), endOf(i));
    }
    emit(Role::Frame, scope, kEnd, endOf(end));
    return true;
  }

  bool readTimeZone(size_t begin, size_t end) {
    std::optional<std::string> tzid;
    std::string name;
    size_t depth = 0;
    for (size_t i = begin; i <= end; ++i) {
      if (lines_[i].blank()) continue;
      nameOf(i, &name);
      if (name == "BEGIN") ++depth;
      if (name == "END") --depth;
      if (depth == 1 && name == "TZID") tzid = trimmed(lineValue(text(i)));
    }
    if (!tzid || tzid->empty()) return fail("a VTIMEZONE has no TZID");
    std::string key = "VTIMEZONE#" + *tzid;
    if (!scopes_.insert(key).second) return fail(format("%@ is there twice", key));
    emit(Role::Block, "", std::move(key), endOf(end));
    return true;
  }

  std::map<std::string, int> unnamed_;  // components without UID, per kind
};

}  // namespace

std::optional<ItemText> readItemText(ItemKind kind, std::string_view bytes, std::string* problem) {
  return TextReader(kind, bytes).read(problem);
}

}  // namespace vtc::client
