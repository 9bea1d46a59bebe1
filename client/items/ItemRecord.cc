#include "client/items/ItemRecord.h"

#include <algorithm>
#include <cstdio>
#include <map>
#include <set>
#include <unordered_map>
#include <unordered_set>

#include "changelog/ChangeLogFormat.h"
#include "client/items/ContentLines.h"
#include "client/items/Meaning.h"

namespace vtc::client {

namespace {

using Role = ItemUnit::Role;

constexpr std::string_view kTimeZonePrefix = "VTIMEZONE#";

// Properties that an item holds at most once: each is one field, known by
// its name. Every other property may repeat and has a key per instance.
bool isSingleton(std::string_view name) {
  static const std::unordered_set<std::string_view> kSingletons = {
      // vCard
      "VERSION", "UID", "FN", "N", "BDAY", "ANNIVERSARY", "GENDER", "REV", "PRODID", "KIND", "NOTE",
      "ORG", "TITLE", "ROLE", "PHOTO", "LOGO", "SOUND", "TZ", "GEO", "CLASS", "SORT-STRING",
      "MAILER", "NICKNAME", "CATEGORIES", "PROFILE", "NAME",
      // iCalendar
      "DTSTAMP", "DTSTART", "DTEND", "DUE", "DURATION", "RRULE", "EXRULE", "RECURRENCE-ID",
      "SUMMARY", "DESCRIPTION", "LOCATION", "STATUS", "TRANSP", "SEQUENCE", "PRIORITY", "CREATED",
      "LAST-MODIFIED", "ORGANIZER", "URL", "COMPLETED", "PERCENT-COMPLETE", "COLOR", "CALSCALE",
      "METHOD", "X-WR-CALNAME", "X-WR-TIMEZONE"};
  return kSingletons.count(name) > 0;
}

// What tells one instance of a property from another, and its two halves
// for matching an edited instance with its earlier form.
struct InstanceFacts {
  std::string identity;
  std::string parameters;
  std::string value;
  bool byIdentityOnly = false;  // an edit of the identity is a new instance
};

std::string trimmedLower(std::string_view s) {
  size_t b = s.find_first_not_of(" \t");
  size_t e = s.find_last_not_of(" \t");
  return b == std::string_view::npos ? std::string() : lowerCase(s.substr(b, e - b + 1));
}

InstanceFacts factsOf(std::string_view baseName, Role role, std::string_view raw) {
  InstanceFacts f;
  if (role == Role::Block) {
    f.identity = meaningOf(raw);
    f.value = f.identity;
    return f;
  }
  std::string unfolded;
  for (const ContentLine& line : readContentLines(raw))
    if (!line.blank()) {
      unfolded.assign(line.text());
      break;
    }
  LineMeaning m = meaningOfLine(unfolded);
  f.parameters = m.parameters;
  f.value = m.value;
  if (baseName == "ATTENDEE") {
    // An attendee is the address: a changed reply or role is an edit of it.
    f.identity = "attendee:" + trimmedLower(m.value);
    f.byIdentityOnly = true;
  } else if (baseName == "EXDATE" || baseName == "RDATE") {
    f.identity = m.name + m.parameters + ":" + m.value;
    f.byIdentityOnly = true;
  } else {
    const size_t pid = m.parameters.find(";PID=");
    if (pid != std::string::npos) {
      const size_t end = m.parameters.find(';', pid + 1);
      f.identity =
          "pid:" + m.parameters.substr(
                       pid + 5, end == std::string::npos ? std::string::npos : end - pid - 5);
      f.byIdentityOnly = true;
    } else {
      f.identity = m.name + m.parameters + ":" + m.value;
    }
  }
  return f;
}

std::string hashText(std::string_view s) {
  const uint64_t h =
      clog::stableHash(ByteView(reinterpret_cast<const uint8_t*>(s.data()), s.size()));
  char buffer[17];
  std::snprintf(buffer, sizeof buffer, "%08x", static_cast<unsigned>(h ^ (h >> 32)));
  return buffer;
}

std::string_view baseNameOf(std::string_view name) {
  const size_t dot = name.rfind('.');
  return dot == std::string_view::npos ? name : name.substr(dot + 1);
}

// Whether a unit's bytes are a nested component (they start with BEGIN).
Role roleOfRaw(std::string_view raw) {
  const size_t start = raw.find_first_not_of(" \t\r\n");
  if (start == std::string_view::npos) return Role::Property;
  return upperCase(lineName(raw.substr(start))) == "BEGIN" ? Role::Block : Role::Property;
}

// The key of a unit without its instance part.
std::string plainKey(const ItemUnit& unit) {
  if (unit.scope.empty()) return unit.name;
  return unit.scope + '/' + unit.name;
}

// Where a key's instance part starts ("#..." after its last "/"), or npos.
size_t instanceMark(std::string_view key) {
  if (key.starts_with(kTimeZonePrefix)) return std::string_view::npos;
  const size_t slash = key.rfind('/');
  const size_t hash = key.find('#', slash == std::string_view::npos ? 0 : slash + 1);
  return hash;
}

}  // namespace

std::string_view scopeOf(std::string_view key) {
  if (key.starts_with(kTimeZonePrefix)) return {};
  const size_t slash = key.rfind('/');
  return slash == std::string_view::npos ? std::string_view() : key.substr(0, slash);
}

std::string_view nameOf(std::string_view key) {
  if (key.starts_with(kTimeZonePrefix)) return key.substr(0, kTimeZonePrefix.size() - 1);
  const size_t slash = key.rfind('/');
  std::string_view name = slash == std::string_view::npos ? key : key.substr(slash + 1);
  const size_t hash = name.find('#');
  return hash == std::string_view::npos ? name : name.substr(0, hash);
}

bool isStructureKey(std::string_view key) {
  if (key == kFileField || key == kOrderField) return true;
  const std::string_view name = nameOf(key);
  return name == kBegin || name == kEnd;
}

std::string recordIdentity(const ItemText& text, const std::string& fileName) {
  if (!text.uid.empty()) return text.uid;
  return "file:" + fileName;
}

Dictionary toRecord(const ItemText& text, const std::string& fileName, const Dictionary* previous) {
  const size_t n = text.units.size();
  std::vector<std::string> keys(n);
  std::unordered_set<std::string> used;
  used.reserve(n * 2);
  // Repeatable units by their plain key, in file order.
  std::map<std::string, std::vector<size_t>> instances;
  for (size_t i = 0; i < n; ++i) {
    const ItemUnit& unit = text.units[i];
    std::string key = plainKey(unit);
    const bool single = unit.role == Role::Frame || unit.name.starts_with(kTimeZonePrefix) ||
                        (unit.role == Role::Property && isSingleton(baseNameOf(unit.name)));
    if (single && used.insert(key).second)
      keys[i] = std::move(key);
    else
      instances[std::move(key)].push_back(i);
  }

  // The earlier instances, by plain key.
  std::unordered_map<std::string, std::vector<std::string>> before;
  if (previous)
    for (const auto& [key, value] : *previous) {
      const size_t mark = instanceMark(key);
      if (mark != std::string::npos) before[key.substr(0, mark)].push_back(key);
    }

  for (auto& [plain, indices] : instances) {
    const std::string_view baseName = baseNameOf(nameOf(plain));
    std::vector<std::string> oldKeys;
    if (auto it = before.find(plain); it != before.end()) oldKeys = it->second;
    std::vector<bool> taken(oldKeys.size(), false);
    std::vector<std::string> chosen(indices.size());
    auto take = [&](size_t k, size_t o) {
      chosen[k] = oldKeys[o];
      taken[o] = true;
    };
    // Most instances are the bytes they were: those keep their keys at once,
    // and only the others are read for what they mean.
    if (!oldKeys.empty()) {
      std::unordered_multimap<std::string_view, size_t> byBytes;
      for (size_t o = oldKeys.size(); o-- > 0;)
        byBytes.emplace(rawOf(previous->get(oldKeys[o])), o);
      for (size_t k = 0; k < indices.size(); ++k) {
        auto [first, last] = byBytes.equal_range(text.units[indices[k]].raw);
        for (auto it = first; it != last; ++it)
          if (!taken[it->second]) {
            take(k, it->second);
            break;
          }
      }
    }
    std::vector<InstanceFacts> now(indices.size()), old(oldKeys.size());
    for (size_t k = 0; k < indices.size(); ++k)
      if (chosen[k].empty())
        now[k] = factsOf(baseName, text.units[indices[k]].role, text.units[indices[k]].raw);
    for (size_t o = 0; o < oldKeys.size(); ++o)
      if (!taken[o]) {
        const std::string_view raw = rawOf(previous->get(oldKeys[o]));
        old[o] = factsOf(baseName, roleOfRaw(raw), raw);
      }
    // The same instance by its identity.
    std::unordered_multimap<std::string_view, size_t> byIdentity;
    for (size_t o = old.size(); o-- > 0;)
      if (!taken[o]) byIdentity.emplace(old[o].identity, o);
    for (size_t k = 0; k < now.size(); ++k) {
      if (!chosen[k].empty()) continue;
      auto [first, last] = byIdentity.equal_range(now[k].identity);
      for (auto it = first; it != last; ++it)
        if (!taken[it->second]) {
          take(k, it->second);
          break;
        }
    }
    // An edit of one half: the parameters or the value stayed.
    for (size_t k = 0; k < now.size(); ++k) {
      if (!chosen[k].empty() || now[k].byIdentityOnly) continue;
      for (size_t o = 0; o < old.size(); ++o)
        if (!taken[o] && !old[o].byIdentityOnly &&
            (old[o].parameters == now[k].parameters || old[o].value == now[k].value)) {
          take(k, o);
          break;
        }
    }
    // The one instance left on each side is the same one, edited.
    std::vector<size_t> openNow, openOld;
    for (size_t k = 0; k < now.size(); ++k)
      if (chosen[k].empty() && !now[k].byIdentityOnly) openNow.push_back(k);
    for (size_t o = 0; o < old.size(); ++o)
      if (!taken[o] && !old[o].byIdentityOnly) openOld.push_back(o);
    if (openNow.size() == 1 && openOld.size() == 1) take(openNow[0], openOld[0]);

    for (std::string& key : chosen)
      if (!key.empty() && !used.insert(key).second) key.clear();
    for (size_t k = 0; k < now.size(); ++k) {
      if (chosen[k].empty()) {
        if (now[k].identity.empty() && now[k].value.empty())
          now[k] = factsOf(baseName, text.units[indices[k]].role, text.units[indices[k]].raw);
        const std::string stem = plain + '#' + hashText(now[k].identity);
        std::string key = stem;
        for (int again = 2; used.count(key); ++again) key = stem + "." + std::to_string(again);
        used.insert(key);
        chosen[k] = std::move(key);
      }
      keys[indices[k]] = std::move(chosen[k]);
    }
  }

  Dictionary record;
  record.reserve(n + 2);
  record.set(kFileField, Value(fileName));
  std::string order;
  for (size_t i = 0; i < n; ++i) {
    if (i) order += '\n';
    order += keys[i];
  }
  record.set(kOrderField, Value(std::move(order)));
  for (size_t i = 0; i < n; ++i) record.set(keys[i], fieldValue(text.units[i].raw));
  return record;
}

Dictionary rekeyInstances(const Dictionary& record, const Dictionary& reference) {
  auto identityKey = [](const std::string& key, const Value& value, size_t mark) {
    const std::string plain = key.substr(0, mark);
    const std::string_view raw = rawOf(value);
    return plain + '\x1f' + factsOf(baseNameOf(nameOf(plain)), roleOfRaw(raw), raw).identity;
  };
  std::unordered_map<std::string, std::string> theirs;
  for (const auto& [key, value] : reference)
    if (size_t mark = instanceMark(key); mark != std::string::npos)
      theirs.emplace(identityKey(key, value, mark), key);
  std::unordered_map<std::string, std::string> renamed;
  for (const auto& [key, value] : record) {
    const size_t mark = instanceMark(key);
    if (mark == std::string::npos) continue;
    auto it = theirs.find(identityKey(key, value, mark));
    if (it != theirs.end() && it->second != key && !record.contains(it->second))
      renamed.emplace(key, it->second);
  }
  if (renamed.empty()) return record;
  auto rename = [&](const std::string& key) -> const std::string& {
    auto it = renamed.find(key);
    return it == renamed.end() ? key : it->second;
  };
  Dictionary out;
  out.reserve(record.size());
  for (const auto& [key, value] : record) out.set(rename(key), value);
  std::vector<std::string> order = recordOrder(record);
  for (std::string& key : order) key = rename(key);
  out.set(kOrderField, Value(joinOrder(order)));
  return out;
}

std::optional<Dictionary> recordOfBytes(ItemKind kind, std::string_view bytes,
                                        const std::string& fileName, const Dictionary* previous,
                                        std::string* problem) {
  std::optional<ItemText> text = readItemText(kind, bytes, problem);
  if (!text) return std::nullopt;
  return toRecord(*text, fileName, previous);
}

std::vector<std::string> recordOrder(const Dictionary& record) {
  std::vector<std::string> keys;
  const Value& order = record.get(kOrderField);
  if (!order.isString()) return keys;
  std::string_view rest = order.string();
  while (!rest.empty()) {
    const size_t lf = rest.find('\n');
    keys.emplace_back(rest.substr(0, lf));
    if (lf == std::string_view::npos) break;
    rest.remove_prefix(lf + 1);
  }
  return keys;
}

std::string joinOrder(const std::vector<std::string>& keys) {
  std::string order;
  for (const std::string& key : keys) {
    if (!order.empty()) order += '\n';
    order += key;
  }
  return order;
}

const std::string& recordFile(const Dictionary& record) {
  static const std::string kNone;
  const Value& file = record.get(kFileField);
  return file.isString() ? file.string() : kNone;
}

std::optional<std::string> renderRecord(const Dictionary& record, const Dictionary* local,
                                        std::string* problem, Dictionary* rendered) {
  auto fail = [&](std::string why) -> std::optional<std::string> {
    if (problem) *problem = std::move(why);
    return std::nullopt;
  };
  std::vector<std::string> order = recordOrder(record);
  std::set<std::string_view> listed(order.begin(), order.end());
  // Units the order does not name, by scope: they go before its end.
  std::map<std::string_view, std::vector<std::string_view>> unlisted;
  for (const auto& [key, value] : record) {
    if (key == kFileField || key == kOrderField || listed.count(key)) continue;
    unlisted[scopeOf(key)].push_back(key);
  }
  if (!listed.count(kBegin) || !listed.count(kEnd)) return fail("it has no frame");

  std::string out;
  std::set<std::string_view> written;
  std::string renderedOrder;
  if (rendered) {
    rendered->clear();
    rendered->reserve(record.size());
    rendered->set(kFileField, record.get(kFileField));
    rendered->set(kOrderField, Value());
  }
  auto append = [&](std::string_view key) -> bool {
    const Value* value = record.find(key);
    if (!value) return true;  // named by the order only
    if (!written.insert(key).second) return true;
    if (rawOf(*value).empty()) return false;
    if (local)
      if (const Value* mine = local->find(key);
          mine && !(*mine == *value) && sameMeaning(*mine, *value))
        value = mine;
    out += rawOf(*value);
    if (rendered) {
      if (!renderedOrder.empty()) renderedOrder += '\n';
      renderedOrder += key;
      rendered->set(key, *value);
    }
    return true;
  };
  for (const std::string& key : order) {
    if (nameOf(key) == kEnd) {
      auto extra = unlisted.find(scopeOf(key));
      if (extra != unlisted.end()) {
        for (std::string_view k : extra->second)
          if (!append(k)) return fail("the value of " + std::string(k) + " is not text");
        unlisted.erase(extra);
      }
      // Whatever has no component left goes before the item's end.
      if (key == kEnd)
        for (const auto& [scope, keys] : unlisted)
          for (std::string_view k : keys)
            if (!append(k)) return fail("the value of " + std::string(k) + " is not text");
    }
    if (!append(key)) return fail("the value of " + key + " is not text");
  }
  if (rendered) rendered->set(kOrderField, Value(std::move(renderedOrder)));
  return out;
}

uint64_t recordDigest(const std::string& id, const Dictionary& record) {
  std::vector<std::pair<std::string_view, std::string_view>> units;
  units.reserve(record.size());
  for (const auto& [key, value] : record) units.emplace_back(key, rawOf(value));
  std::sort(units.begin(), units.end());
  auto bytes = [](std::string_view s) {
    return ByteView(reinterpret_cast<const uint8_t*>(s.data()), s.size());
  };
  const uint8_t separator = 0;
  uint64_t h = clog::stableHash(bytes(id));
  for (const auto& [key, raw] : units) {
    h = clog::stableHash(ByteView(&separator, 1), h);
    h = clog::stableHash(bytes(key), h);
    h = clog::stableHash(ByteView(&separator, 1), h);
    h = clog::stableHash(bytes(raw), h);
  }
  return h;
}

std::string displayName(const Dictionary& record) {
  for (const std::string& key : recordOrder(record)) {
    const std::string_view name = nameOf(key);
    if (name != "FN" && name != "SUMMARY") continue;
    const std::string_view raw = rawOf(record.get(key));
    for (const ContentLine& line : readContentLines(raw))
      if (!line.blank()) {
        std::string value = meaningOfLine(line.text()).value;
        if (!value.empty()) return value;
      }
  }
  return recordFile(record);
}

}  // namespace vtc::client
