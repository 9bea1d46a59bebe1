#include "client/stores/ItemLayout.h"

#include <set>
#include <unordered_map>
#include <utility>

#include "client/stores/ContentLines.h"
#include "common/Format.h"

namespace vtc::client {

namespace {

using Role = ItemUnit::Role;

// The word after BEGIN: or END:, upper case, without trailing blanks.
std::string componentName(std::string_view text) {
  std::string_view value = lineValue(text);
  while (!value.empty() && (value.back() == ' ' || value.back() == '\t')) value.remove_suffix(1);
  return upperCase(value);
}

class LayoutReader {
 public:
  LayoutReader(ItemKind kind, std::string_view bytes) : kind_(kind), bytes_(bytes) {
    // Some programs start their files with a byte order mark; it stays.
    constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";
    if (bytes_.starts_with(kByteOrderMark)) {
      layout_.units.push_back({Role::Blank, bytes_.substr(0, kByteOrderMark.size()), {}, {}});
      bytes_.remove_prefix(kByteOrderMark.size());
    }
    lines_ = readContentLines(bytes_);
  }

  std::optional<ItemLayout> read(std::string* problem) {
    bool ok = kind_ == ItemKind::Contacts ? readCard() : readCalendar();
    if (!ok) {
      if (problem) *problem = problem_;
      return std::nullopt;
    }
    collectFields();
    return std::move(layout_);
  }

 private:
  ItemKind kind_;
  std::string_view bytes_;
  std::vector<ContentLine> lines_;
  size_t next_ = 0;
  ItemLayout layout_;
  std::string problem_;

  bool fail(std::string problem) {
    problem_ = std::move(problem);
    return false;
  }
  bool failAtLine(size_t index, const char* what) {
    return fail(format("line %zu %s", index + 1, what));
  }

  std::string_view text(size_t index) const { return lines_[index].text(); }
  // The upper-case name of a content line; false (with the problem set) for
  // a line that is no content line.
  bool nameOf(size_t index, std::string* name) {
    std::string_view n = lineName(text(index));
    if (n.empty()) return failAtLine(index, "is not a content line");
    *name = upperCase(n);
    return true;
  }

  void add(Role role, size_t index, std::string key = {}, std::string container = {}) {
    layout_.units.push_back({role, lines_[index].raw, std::move(key), std::move(container)});
  }

  // Blank lines before the item, then BEGIN:<what>.
  bool readBegin(const char* what) {
    for (; next_ < lines_.size() && lines_[next_].blank(); ++next_) add(Role::Blank, next_);
    std::string name;
    if (next_ == lines_.size()) return fail(format("there is no BEGIN:%s", what));
    if (!nameOf(next_, &name)) return false;
    if (name != "BEGIN" || componentName(text(next_)) != what)
      return fail(format("it does not start with BEGIN:%s", what));
    add(Role::Begin, next_++);
    return true;
  }

  // Only blank lines may follow the item's END.
  bool readTail(const char* what) {
    for (; next_ < lines_.size(); ++next_) {
      if (!lines_[next_].blank()) return fail(format("there is more after END:%s", what));
      add(Role::Blank, next_);
    }
    return true;
  }

  bool readCard() {
    if (!readBegin("VCARD")) return false;
    for (std::string name; next_ < lines_.size(); ++next_) {
      if (lines_[next_].blank()) {
        add(Role::Blank, next_);
        continue;
      }
      if (!nameOf(next_, &name)) return false;
      if (name == "BEGIN") return failAtLine(next_, "begins a component inside the vCard");
      if (name == "END") {
        if (componentName(text(next_)) != "VCARD") return failAtLine(next_, "ends no vCard");
        add(Role::End, next_++);
        return readTail("VCARD");
      }
      add(Role::Property, next_, std::move(name));
    }
    return fail("there is no END:VCARD");
  }

  bool readCalendar() {
    if (!readBegin("VCALENDAR")) return false;
    for (std::string name; next_ < lines_.size();) {
      if (lines_[next_].blank()) {
        add(Role::Blank, next_++);
        continue;
      }
      if (!nameOf(next_, &name)) return false;
      if (name == "END") {
        if (componentName(text(next_)) != "VCALENDAR") return failAtLine(next_, "ends nothing");
        add(Role::End, next_++);
        return readTail("VCALENDAR");
      }
      if (name == "BEGIN") {
        if (!readComponent()) return false;
        continue;
      }
      add(Role::Property, next_++, kCalendarPrefix + name);
    }
    return fail("there is no END:VCALENDAR");
  }

  // The index of the END line that closes the BEGIN at `begin`.
  bool blockEnd(size_t begin, size_t* end) {
    std::vector<std::string> open;
    std::string name;
    for (size_t i = begin; i < lines_.size(); ++i) {
      if (lines_[i].blank()) continue;
      if (!nameOf(i, &name)) return false;
      if (name == "BEGIN") {
        open.push_back(componentName(text(i)));
        if (open.back() == "VCALENDAR") return failAtLine(i, "begins a calendar inside another");
      } else if (name == "END") {
        if (componentName(text(i)) != open.back()) return failAtLine(i, "ends another component");
        open.pop_back();
        if (open.empty()) {
          *end = i;
          return true;
        }
      }
    }
    return fail(format("BEGIN:%@ has no END", open.front()));
  }

  std::string_view rawLines(size_t first, size_t last) const {
    const char* from = lines_[first].raw.data();
    const char* to = lines_[last].raw.data() + lines_[last].raw.size();
    return bytes_.substr(static_cast<size_t>(from - bytes_.data()), static_cast<size_t>(to - from));
  }

  // A component at the calendar's level, BEGIN to END: a time zone whole,
  // or an event, to-do or journal entry split into its properties and its
  // nested components (alarms), keyed by its UID and RECURRENCE-ID.
  bool readComponent() {
    size_t begin = next_, end = 0;
    if (!blockEnd(begin, &end)) return false;
    next_ = end + 1;
    std::string kind = componentName(text(begin));
    if (kind == "VTIMEZONE") return readTimeZone(begin, end);

    std::optional<std::string> uid, recurrenceId;
    std::vector<ItemUnit> units;
    units.push_back({Role::Begin, lines_[begin].raw, {}, {}});
    std::string name;
    for (size_t i = begin + 1; i < end; ++i) {
      if (lines_[i].blank()) {
        units.push_back({Role::Blank, lines_[i].raw, {}, {}});
        continue;
      }
      nameOf(i, &name);  // blockEnd has checked every line
      if (name == "BEGIN") {
        size_t nestedEnd = 0;
        blockEnd(i, &nestedEnd);
        units.push_back({Role::Block, rawLines(i, nestedEnd), componentName(text(i)), {}});
        i = nestedEnd;
        continue;
      }
      if (name == "UID" || name == "RECURRENCE-ID") {
        auto& slot = name == "UID" ? uid : recurrenceId;
        if (slot) return failAtLine(i, "repeats a property that names the component");
        slot = std::string(lineValue(text(i)));
      }
      units.push_back({Role::Property, lines_[i].raw, name, {}});
    }
    units.push_back({Role::End, lines_[end].raw, {}, {}});
    if (!uid || uid->empty()) return fail(format("a %@ has no UID", kind));

    std::string container = kind + '/' + *uid;
    if (recurrenceId) container += '/' + *recurrenceId;
    if (!containers_.insert(container).second) return fail(format("%@ is there twice", container));
    for (ItemUnit& unit : units) {
      if (!unit.key.empty()) unit.key = container + '/' + unit.key;
      unit.container = container;
      layout_.units.push_back(std::move(unit));
    }
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
      if (depth == 1 && name == "TZID") tzid = std::string(lineValue(text(i)));
    }
    if (!tzid || tzid->empty()) return fail("a VTIMEZONE has no TZID");
    std::string key = kTimeZonePrefix + *tzid;
    if (!containers_.insert(key).second) return fail(format("%@ is there twice", key));
    layout_.units.push_back({Role::Block, rawLines(begin, end), std::move(key), {}});
    return true;
  }

  // Joins the lines of each field in file order, conforming.
  void collectFields() {
    std::vector<std::pair<std::string, std::string>> fields;
    std::unordered_map<std::string_view, size_t> index;
    for (const ItemUnit& unit : layout_.units) {
      if (unit.key.empty()) continue;
      auto [it, added] = index.emplace(unit.key, fields.size());
      if (added) fields.emplace_back(unit.key, std::string());
      appendConformingLines(fields[it->second].second, unit.raw);
    }
    layout_.fields.reserve(fields.size());
    for (auto& [key, value] : fields) layout_.fields.set(key, Value(std::move(value)));
  }

  std::set<std::string> containers_;  // components and time zones seen
};

}  // namespace

std::optional<ItemLayout> readItemLayout(ItemKind kind, std::string_view bytes,
                                         std::string* problem) {
  return LayoutReader(kind, bytes).read(problem);
}

}  // namespace vtc::client
