#include "client/merge/RecordMerge.h"

#include <map>
#include <set>

#include "client/items/ItemCheck.h"
#include "client/items/ItemRecord.h"
#include "client/items/Meaning.h"
#include "client/merge/OrderMerge.h"

namespace vtc::client::merge {

namespace {

using Record = std::optional<Dictionary>;

bool same(const Value* a, const Value* b) {
  if (!a || !b) return a == b;
  return sameMeaning(*a, *b);
}

Value valueOf(const Value* v) {
  return v ? *v : Value();
}

bool isContentKey(std::string_view key) {
  return key != kFileField && key != kOrderField;
}

// Whether two versions hold the same content, by meaning.
bool sameContent(const Dictionary& a, const Dictionary& b) {
  for (const auto& [key, value] : a)
    if (isContentKey(key) && !same(&value, b.find(key))) return false;
  for (const auto& [key, value] : b)
    if (isContentKey(key) && !a.contains(key)) return false;
  return true;
}

// The content keys of several versions, each once.
std::vector<std::string> unionOfKeys(std::initializer_list<const Dictionary*> versions) {
  std::vector<std::string> keys;
  std::set<std::string_view> seen;
  for (const Dictionary* v : versions)
    for (const auto& [key, value] : *v)
      if (isContentKey(key) && seen.insert(key).second) keys.push_back(key);
  return keys;
}

// Components: "<kind>/<recurrence-id>/<uid>" scopes with a frame.
struct Scope {
  std::string_view kind, recurrenceId, uid;
};
Scope parseScope(std::string_view scope) {
  Scope s;
  const size_t first = scope.find('/');
  if (first == std::string_view::npos) return s;
  const size_t second = scope.find('/', first + 1);
  if (second == std::string_view::npos) return s;
  s.kind = scope.substr(0, first);
  s.recurrenceId = scope.substr(first + 1, second - first - 1);
  s.uid = scope.substr(second + 1);
  return s;
}

std::set<std::string> scopesOf(const Dictionary& record) {
  std::set<std::string> scopes;
  for (const auto& [key, value] : record) {
    const std::string_view scope = scopeOf(key);
    if (!scope.empty() && nameOf(key) == kBegin) scopes.emplace(scope);
  }
  return scopes;
}

bool inScope(std::string_view key, std::string_view scope) {
  return scopeOf(key) == scope;
}

// Whether any unit of the component differs between two versions.
bool changedIn(std::string_view scope, const Dictionary& a, const Dictionary& b) {
  for (const auto& [key, value] : a)
    if (inScope(key, scope) && !same(&value, b.find(key))) return true;
  for (const auto& [key, value] : b)
    if (inScope(key, scope) && !a.contains(key)) return true;
  return false;
}

// The component's units from `from` replace those in `into`.
void takeScope(Dictionary& into, const Dictionary& from, std::string_view scope) {
  for (const std::string& key : into.keys())
    if (inScope(key, scope)) into.erase(key);
  for (const auto& [key, value] : from)
    if (inScope(key, scope)) into.set(key, value);
}

// A component's bytes, in the version's order, for a lost value.
Value scopeBytes(const Dictionary& record, std::string_view scope) {
  std::string bytes;
  for (const std::string& key : recordOrder(record))
    if (inScope(key, scope))
      if (const Value* v = record.find(key)) bytes += rawOf(*v);
  return bytes.empty() ? Value() : fieldValue(bytes);
}

constexpr const char* kTimeNames[] = {"DTSTART", "DTEND", "DUE", "DURATION", "RRULE", "EXRULE"};

std::vector<std::string> timeKeys(std::string_view scope) {
  std::vector<std::string> keys;
  for (const char* name : kTimeNames) keys.push_back(std::string(scope) + "/" + name);
  return keys;
}

bool timesChanged(std::string_view scope, const Dictionary& from, const Dictionary& to) {
  for (const std::string& key : timeKeys(scope))
    if (!same(from.find(key), to.find(key))) return true;
  return false;
}

class FieldMerge {
 public:
  FieldMerge(ItemKind kind, const Dictionary& base, const Dictionary& ours,
             const Dictionary& theirs)
      : kind_(kind), base_(base), ours_(ours), theirs_(theirs) {}

  Merged run() {
    components();
    fields();
    timeUnits();
    seriesAgainstOccurrences();
    structure();
    check();
    return std::move(result_);
  }

 private:
  ItemKind kind_;
  const Dictionary &base_, &ours_, &theirs_;
  Dictionary merged_;
  Merged result_;
  std::set<std::string> settled_;  // components decided whole
  std::set<std::string> lostKeys_;

  void lose(const std::string& key, Value kept, Value lost) {
    if (!lostKeys_.insert(key).second) return;
    result_.lost.push_back({key, std::move(kept), std::move(lost)});
  }
  void forget(const std::string& key) {
    if (!lostKeys_.erase(key)) return;
    std::erase_if(result_.lost, [&](const LostValue& l) { return l.key == key; });
  }
  void set(const std::string& key, const Value* value) {
    if (value)
      merged_.set(key, *value);
    else
      merged_.erase(key);
  }

  // An edit beats a delete of a component (an occurrence, or one of several
  // events in a file): it comes back whole from the side that edited it.
  void components() {
    for (const std::string& scope : scopesOf(base_)) {
      const bool inOurs = ours_.contains(scope + "/" + kBegin);
      const bool inTheirs = theirs_.contains(scope + "/" + kBegin);
      if (inOurs && !inTheirs && changedIn(scope, base_, ours_)) {
        takeScope(merged_, ours_, scope);
        settled_.insert(scope);
      } else if (!inOurs && inTheirs && changedIn(scope, base_, theirs_)) {
        takeScope(merged_, theirs_, scope);
        settled_.insert(scope);
        lose(scope + "/" + kComponentName, scopeBytes(theirs_, scope), Value());
      }
    }
  }

  void fields() {
    for (const std::string& key : unionOfKeys({&theirs_, &ours_, &base_})) {
      if (settled_.count(std::string(scopeOf(key)))) continue;
      const Value *b = base_.find(key), *o = ours_.find(key), *t = theirs_.find(key);
      const bool oursChanged = !same(b, o);
      const bool theirsChanged = !same(b, t);
      if (!oursChanged) {
        set(key, t);
      } else if (!theirsChanged) {
        set(key, o);
      } else if (isStamp(key) && o && t) {
        // A stamp of when the item changed: the later one stands, and two
        // stamps are no conflict.
        set(key, meaningOf(rawOf(*o)) > meaningOf(rawOf(*t)) ? o : t);
      } else {
        set(key, t);
        if (!same(o, t) && !isStructureKey(key)) lose(key, valueOf(t), valueOf(o));
      }
    }
  }

  // Properties that say when an item last changed, which every edit moves.
  static bool isStamp(std::string_view key) {
    const std::string_view name = nameOf(key);
    return name == "REV" || name == "DTSTAMP" || name == "LAST-MODIFIED";
  }

  // If both sides changed an event's times, theirs stand together.
  void timeUnits() {
    std::set<std::string> scopes = scopesOf(merged_);
    for (const std::string& scope : scopes) {
      if (settled_.count(scope)) continue;
      if (!timesChanged(scope, base_, ours_) || !timesChanged(scope, base_, theirs_)) continue;
      if (!timesChanged(scope, ours_, theirs_)) continue;
      for (const std::string& key : timeKeys(scope)) {
        const Value *b = base_.find(key), *o = ours_.find(key), *t = theirs_.find(key);
        set(key, t);
        if (!same(b, o) && !same(o, t)) lose(key, valueOf(t), valueOf(o));
      }
    }
  }

  // A series moved or re-ruled on one side against occurrences changed on
  // the other: the occurrences would no longer fall where they were, so
  // the side that reached the share first stands.
  void seriesAgainstOccurrences() {
    if (kind_ != ItemKind::Calendars) return;
    std::set<std::string> all = scopesOf(base_);
    for (const Dictionary* d : {&ours_, &theirs_})
      for (const std::string& s : scopesOf(*d)) all.insert(s);
    for (const std::string& master : all) {
      const Scope m = parseScope(master);
      if (m.kind.empty() || !m.recurrenceId.empty() || settled_.count(master)) continue;
      std::vector<std::string> occurrences;
      for (const std::string& s : all) {
        const Scope o = parseScope(s);
        if (o.kind == m.kind && o.uid == m.uid && !o.recurrenceId.empty()) occurrences.push_back(s);
      }
      if (occurrences.empty()) continue;
      auto changedBy = [&](const Dictionary& side) {
        std::vector<std::string> changed;
        for (const std::string& s : occurrences)
          if (changedIn(s, base_, side)) changed.push_back(s);
        return changed;
      };
      if (timesChanged(master, base_, theirs_)) {
        for (const std::string& s : changedBy(ours_)) {
          if (!changedIn(s, ours_, theirs_)) continue;
          takeScope(merged_, theirs_, s);
          for (const Dictionary* side : {&ours_, &theirs_})
            for (const auto& [key, value] : *side)
              if (inScope(key, s)) forget(key);
          lose(s + "/" + kComponentName, scopeBytes(theirs_, s), scopeBytes(ours_, s));
        }
      } else if (timesChanged(master, base_, ours_) && !changedBy(theirs_).empty()) {
        for (const std::string& key : timeKeys(master)) {
          const Value *b = base_.find(key), *o = ours_.find(key), *t = theirs_.find(key);
          set(key, t);
          if (!same(b, o) && !same(o, t)) lose(key, valueOf(t), valueOf(o));
        }
      }
    }
  }

  // The file name and the order of the units.
  void structure() {
    const Value *b = base_.find(kFileField), *o = ours_.find(kFileField),
                *t = theirs_.find(kFileField);
    const Value* file = t;
    if (!t || (o && b && *t == *b && !(*o == *b))) file = o;
    if (file) merged_.set(kFileField, *file);
    std::vector<std::string> keys;
    for (const auto& [key, value] : merged_)
      if (isContentKey(key)) keys.push_back(key);
    merged_.set(kOrderField, Value(joinOrder(mergeOrder(recordOrder(base_), recordOrder(ours_),
                                                        recordOrder(theirs_), keys))));
  }

  // The result must be no worse an item than its inputs.
  void check() {
    std::string problem;
    std::optional<std::string> bytes = renderRecord(merged_, nullptr, &problem);
    std::optional<std::string> theirsBytes = renderRecord(theirs_);
    std::optional<std::string> oursBytes = renderRecord(ours_);
    std::vector<std::string_view> inputs;
    if (theirsBytes) inputs.push_back(*theirsBytes);
    if (oursBytes) inputs.push_back(*oursBytes);
    const bool bad = !bytes || newProblem(kind_, *bytes, inputs).has_value();
    if (bad) {
      merged_ = theirs_;
      result_.lost.clear();
      lostKeys_.clear();
      lose(kRecordField, Value(), Value(ours_));
    }
    result_.record = std::move(merged_);
  }
};

}  // namespace

bool sameRecord(const Record& a, const Record& b) {
  if (!a || !b) return !a && !b;
  return sameContent(*a, *b) && a->get(kFileField) == b->get(kFileField) &&
         a->get(kOrderField) == b->get(kOrderField);
}

Merged mergeRecord(ItemKind kind, const Record& base, const Record& ours, const Record& theirs) {
  Merged m;
  if (!base) {
    // No common base: what one side has alone stands; the two are joined.
    if (!ours || !theirs) {
      m.record = ours ? ours : theirs;
      return m;
    }
    return FieldMerge(kind, Dictionary{}, rekeyInstances(*ours, *theirs), *theirs).run();
  }
  if (!ours) {
    if (!theirs || sameContent(*base, *theirs)) return m;  // the delete stands
    m.record = theirs;
    m.deleteUndone = true;
    m.lost.push_back({kRecordField, Value(), Value()});
    return m;
  }
  if (!theirs) {
    if (sameContent(*base, *ours)) return m;
    m.record = ours;
    m.restoredHere = true;
    return m;
  }
  // One side unchanged, byte for byte: the other stands as it is.
  if (*ours == *base) {
    m.record = theirs;
    return m;
  }
  if (*theirs == *base) {
    m.record = ours;
    return m;
  }
  return FieldMerge(kind, *base, *ours, *theirs).run();
}

Merged localVersion(ItemKind kind, const Record& truth, const Record& fileBefore,
                    const Record& fileNow) {
  Merged m;
  if (!fileBefore && !fileNow) {
    m.record = truth;
    return m;
  }
  if (!fileBefore) return mergeRecord(kind, std::nullopt, fileNow, truth);
  if (!fileNow) {
    if (!truth || sameContent(*fileBefore, *truth)) return m;
    // Deleted here before the change the truth holds reached the file.
    m.record = truth;
    m.deleteUndone = true;
    m.lost.push_back({kRecordField, Value(), Value()});
    return m;
  }
  if (!truth) {
    // Edited here after a delete made elsewhere: the edit brings it back.
    m.record = fileNow;
    m.restoredHere = true;
    return m;
  }
  Dictionary ours = *truth;
  for (const std::string& key : unionOfKeys({&*fileBefore, &*fileNow})) {
    const Value *before = fileBefore->find(key), *now = fileNow->find(key);
    if (same(before, now)) continue;
    const Value* t = truth->find(key);
    if (same(t, before)) {
      if (now)
        ours.set(key, *now);
      else
        ours.erase(key);
    } else if (!same(t, now) && !isStructureKey(key)) {
      m.lost.push_back({key, valueOf(t), valueOf(now)});
    }
  }
  const Value& fileWas = fileBefore->get(kFileField);
  const Value& fileIs = fileNow->get(kFileField);
  if (!(fileWas == fileIs) && truth->get(kFileField) == fileWas) ours.set(kFileField, fileIs);
  std::vector<std::string> keys;
  for (const auto& [key, value] : ours)
    if (isContentKey(key)) keys.push_back(key);
  ours.set(kOrderField, Value(joinOrder(mergeOrder(recordOrder(*fileBefore), recordOrder(*fileNow),
                                                   recordOrder(*truth), keys))));
  m.record = std::move(ours);
  return m;
}

Array recordChanges(const Dictionary& from, const Dictionary& to) {
  Array changes;
  for (const auto& [key, value] : to) {
    const Value* old = from.find(key);
    if (!old || !(*old == value))
      changes.push_back(Value(Dictionary{{"action", "set"}, {"name", key}, {"value", value}}));
  }
  for (const auto& [key, value] : from)
    if (!to.contains(key)) changes.push_back(Value(Dictionary{{"action", "clear"}, {"name", key}}));
  return changes;
}

void applyChanges(Dictionary& record, const Array& changes) {
  for (const Value& change : changes) {
    if (!change.isDictionary()) continue;
    const Dictionary& d = change.dictionary();
    const Value& name = d.get("name");
    if (!name.isString() || name.string().empty()) continue;
    const std::string& action = d.get("action").string();
    if (action == "set" && !d.get("value").isNone())
      record.set(name.string(), d.get("value"));
    else if (action == "clear")
      record.erase(name.string());
  }
}

Array recordSets(const Dictionary& record) {
  Array sets;
  sets.reserve(record.size());
  for (const auto& [key, value] : record)
    sets.push_back(Value(Dictionary{{"action", "set"}, {"name", key}, {"value", value}}));
  return sets;
}

}  // namespace vtc::client::merge
