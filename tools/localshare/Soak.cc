#include "localshare/Soak.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <map>
#include <mutex>
#include <random>
#include <set>
#include <sstream>
#include <thread>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "platform/plist/PlistCodec.h"

namespace vtc::local {

namespace {

using Clock = std::chrono::steady_clock;

// One edit made in a folder. Items are known by their UID; a field is a
// property ("TEL", "EMAIL;TYPE=home"), or an event's SUMMARY of the series
// ("SUMMARY") or of its one moved occurrence ("SUMMARY@<recurrence-id>").
struct Edit {
  enum Kind { Add, Set, Delete, Rename, Exception } kind;
  Clock::time_point when;
  int computer;
  std::string uid;
  std::string field;  // a Set's field
  std::string value;  // a Set's value, a Rename's new name, an Exception's date
};

constexpr const char* kOccurrence = "20250113T100000Z";
const char* const kCardFields[] = {"TEL", "NOTE", "EMAIL;TYPE=home", "EMAIL;TYPE=work"};
const char* const kEventFields[] = {"SUMMARY", "SUMMARY@20250113T100000Z"};

std::string card(const std::string& uid, const std::string& value) {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + uid + "\r\nFN:Person " + uid + "\r\nTEL:" + value +
         "\r\nNOTE:" + value + "\r\nEMAIL;TYPE=home:home-" + value + "@example.org\r\n" +
         "EMAIL;TYPE=work:work-" + value + "@example.org\r\nEND:VCARD\r\n";
}

std::string event(const std::string& uid, const std::string& value) {
  return "BEGIN:VCALENDAR\r\nVERSION:2.0\r\nPRODID:-//Soak//EN\r\nBEGIN:VEVENT\r\nUID:" + uid +
         "\r\nDTSTAMP:20250101T000000Z\r\nDTSTART:20250106T100000Z\r\nDTEND:20250106T110000Z\r\n"
         "RRULE:FREQ=WEEKLY;COUNT=20\r\nSUMMARY:" +
         value + "\r\nEND:VEVENT\r\nBEGIN:VEVENT\r\nUID:" + uid +
         "\r\nRECURRENCE-ID:" + kOccurrence +
         "\r\nDTSTAMP:20250101T000000Z\r\nDTSTART:20250113T140000Z\r\nDTEND:20250113T150000Z\r\n"
         "SUMMARY:" +
         value + " moved\r\nEND:VEVENT\r\nEND:VCALENDAR\r\n";
}

// Where a field's value starts in an item's bytes, or npos.
size_t valueAt(const std::string& content, const std::string& field) {
  std::string name = field;
  size_t from = 0;
  if (const size_t at = field.find('@'); at != std::string::npos) {
    name = field.substr(0, at);
    from = content.find("RECURRENCE-ID:" + field.substr(at + 1));
    if (from == std::string::npos) return from;
  }
  const std::string key = "\r\n" + name + ":";
  const size_t found = content.find(key, from);
  return found == std::string::npos ? found : found + key.size();
}

// A field's value, or "" when the item has none.
std::string valueOf(const std::string& content, const std::string& field) {
  const size_t at = valueAt(content, field);
  if (at == std::string::npos) return "";
  return content.substr(at, content.find("\r\n", at) - at);
}

// Replaces an item's file, the way an editor saves: a new file renamed over
// the old one.
bool save(const std::string& path, const std::string& content) {
  const std::string temporary = std::filesystem::path(path).parent_path() / ".edit.tmp";
  Computer::write(temporary, content);
  std::error_code error;
  std::filesystem::rename(temporary, path, error);
  return !error;
}

bool setField(const std::string& path, const std::string& field, const std::string& value) {
  std::string content = Computer::read(path);
  const size_t at = valueAt(content, field);
  if (at == std::string::npos) return false;
  content.replace(at, content.find("\r\n", at) - at, value);
  return save(path, content);
}

std::string uidOf(const std::string& content) {
  return valueOf(content, "UID");
}

// The items of a folder by UID.
std::map<std::string, std::string> itemsByUid(const std::string& folder) {
  std::map<std::string, std::string> items;
  for (const auto& [name, content] : Computer::files(folder)) items[uidOf(content)] = content;
  return items;
}

std::vector<std::string> itemNames(const std::string& folder, const char* extension) {
  std::vector<std::string> names;
  for (const auto& [name, content] : Computer::files(folder))
    if (name.ends_with(extension)) names.push_back(name);
  return names;
}

// Every losing value kept on a computer: "uid field lost", the field as the
// model names it; a delete that lost is "uid (record) deleted".
std::vector<std::string> lostValues(const Computer& c) {
  std::vector<std::string> lost;
  std::error_code error;
  const std::string folder = c.home() + "/.local/share/NubiloSyncClient/Conflicts";
  for (auto it = std::filesystem::directory_iterator(folder, error);
       !error && it != std::filesystem::directory_iterator(); it.increment(error))
    if (auto kept = plist::readFile(it->path().string())) {
      const Dictionary& d = kept->dictionary();
      // "TEL#1f3a09c2" is a TEL; "VEVENT/<rid>/<uid>/SUMMARY" the occurrence's.
      const std::string key = d.get("Field").string();
      const size_t slash = key.rfind('/');
      std::string field = key.substr(slash == std::string::npos ? 0 : slash + 1);
      field = field.substr(0, field.find('#'));
      if (slash != std::string::npos) {
        const size_t first = key.find('/');
        const std::string rid = key.substr(first + 1, key.find('/', first + 1) - first - 1);
        if (!rid.empty()) field += "@" + rid;
      }
      const Value& value = d.get("Lost");
      std::string text = value.isString() ? value.string() : "deleted";
      if (value.kind() == Value::Kind::Data) text.assign(value.data().begin(), value.data().end());
      lost.push_back(d.get("Record").string() + " " + field + " " + text);
    }
  return lost;
}

int64_t lockWaits(const Computer& c) {
  const std::string log = Computer::read(c.home() + "/Library/Logs/Sync/nubilosync.log");
  int64_t waits = 0;
  for (size_t at = 0; (at = log.find("|Warning|Lock attempt ", at)) != std::string::npos; ++at)
    ++waits;
  return waits;
}

// A record in the form the sync client keeps items in: file name, units in order.
Dictionary recordOf(const std::string& file,
                    const std::vector<std::pair<std::string, std::string>>& units) {
  Dictionary record{{"(file)", file}};
  std::string order;
  for (const auto& [key, raw] : units) order += (order.empty() ? "" : "\n") + key;
  record.set("(order)", Value(order));
  for (const auto& [key, raw] : units) record.set(key, Value(raw));
  return record;
}

Array setsOf(const Dictionary& record) {
  Array sets;
  for (const auto& [key, value] : record)
    sets.push_back(Value(Dictionary{{"action", "set"}, {"name", key}, {"value", value}}));
  return sets;
}

// A faulty fourth computer commits a changelog holding a card whose field is
// no content line, beside a good card, under the dataclass lock as any
// computer does.
std::string commitPoison(const Share& share, const std::string& syncPath) {
  try {
    Dictionary config = share.configuration();
    config.set("sync_path", Value(syncPath));
    config.set("guid", Value("FAULTY-0000"));
    config.set("ClientName", Value("Faulty Phone"));
    auto session = NubiloRemoteSession::sessionWithUsername(Share::kUser, Share::kPassword, config);
    const std::string dataclass = "com.korvo.Contacts";
    session->registerClient("FAULTY-0000", "Faulty Phone");
    session->lockClient();
    session->lockDataclass(dataclass);
    const int64_t next = session->getDataclassInfo(dataclass).get("maxversion").integer() + 1;
    const Dictionary evil = recordOf("evil.vcf", {{"(begin)", "BEGIN:VCARD\r\n"},
                                                  {"FN", "no content line here\r\n"},
                                                  {"(end)", "END:VCARD\r\n"}});
    const Dictionary good = recordOf("poisoned-good.vcf", {{"(begin)", "BEGIN:VCARD\r\n"},
                                                           {"VERSION", "VERSION:3.0\r\n"},
                                                           {"UID", "UID:poisoned-good\r\n"},
                                                           {"FN", "FN:Sent beside the poison\r\n"},
                                                           {"(end)", "END:VCARD\r\n"}});
    session->commitChanges(
        {SyncEngineChange(SyncEngineChange::kAdd, "evil", setsOf(evil)),
         SyncEngineChange(SyncEngineChange::kAdd, "poisoned-good", setsOf(good))},
        dataclass, next, false);
    session->unlockDataclass(dataclass);
    session->unlockClient();
    return "";
  } catch (const std::exception& e) {
    return e.what();
  }
}

}  // namespace

SoakReport runSoak(const SoakOptions& options) {
  SoakReport report;
  const auto started = Clock::now();
  auto tell = [&](const std::string& what) {
    if (!options.progress) return;
    char at[32];
    std::snprintf(at, sizeof at,
                  "%.1f s: ", std::chrono::duration<double>(Clock::now() - started).count());
    options.progress(at + what);
  };
  // A run of the client, told when it is slow.
  auto run = [&](const Computer& c, const std::vector<std::string>& args) {
    const auto before = Clock::now();
    Computer::Result r = c.run(args);
    const double took = std::chrono::duration<double>(Clock::now() - before).count();
    if (took > 10)
      tell(c.name() + "'s " + args[0] + " took " + std::to_string(static_cast<int>(took)) +
           " s and ended with status " + std::to_string(r.status));
    return r;
  };
  // Synced, with nothing left over but the faulty computer's record.
  auto fine = [](const Computer::Result& r) {
    if (r.status == 0) return true;
    if (r.status != 9) return false;
    std::istringstream lines(r.err);
    for (std::string line; std::getline(lines, line);)
      if (line.find("set aside evil.vcf (from Faulty Phone)") == std::string::npos) return false;
    return true;
  };
  ApacheShare share;
  const std::string url = "http://127.0.0.1:" + std::to_string(share.port()) + "/soak";
  std::vector<std::unique_ptr<Computer>> computers;
  for (int k = 0; k < options.computers; ++k) {
    computers.push_back(std::make_unique<Computer>("Mac " + std::to_string(k + 1)));
    computers.back()->join(url, ApacheShare::kUser, ApacheShare::kPassword);
  }
  std::mutex mutex;  // guards the edit log and the counters
  std::vector<Edit> edits;
  for (int i = 0; i < options.startingCards; ++i) {
    const std::string uid = "s" + std::to_string(i);
    Computer::write(computers[0]->contacts() + "/" + uid + ".vcf", card(uid, "start"));
    edits.push_back({Edit::Add, Clock::now(), 0, uid, "", ""});
    if (i % 5 == 0) {
      const std::string e = "e" + std::to_string(i);
      Computer::write(computers[0]->calendars() + "/" + e + ".ics", event(e, "start"));
      edits.push_back({Edit::Add, Clock::now(), 0, e, "", ""});
    }
  }
  for (auto& c : computers) run(*c, {"sync"});
  tell("the computers joined and took in the first items");

  const auto deadline = Clock::now() + std::chrono::duration_cast<Clock::duration>(
                                           std::chrono::duration<double>(options.seconds));
  std::atomic<bool> poisoned = false;
  std::thread faulty([&] {
    while (Clock::now() < started + (deadline - started) / 3)
      std::this_thread::sleep_for(std::chrono::milliseconds(100));
    const std::string failure = commitPoison(share, "/soak");
    std::lock_guard<std::mutex> lock(mutex);
    if (failure.empty())
      poisoned = true;
    else
      report.problems.push_back("the faulty computer could not commit: " + failure);
  });
  std::vector<std::thread> loops;
  for (int k = 0; k < options.computers; ++k) {
    loops.emplace_back([&, k] {
      const Computer& c = *computers[k];
      std::mt19937 random(options.seed * 7919 + static_cast<unsigned>(k));
      int serial = 0;
      auto pick = [&](const std::vector<std::string>& names) -> const std::string& {
        return names[random() % names.size()];
      };
      auto note = [&](Edit edit) {
        std::lock_guard<std::mutex> lock(mutex);
        edits.push_back(std::move(edit));
      };
      while (Clock::now() < deadline) {
        for (int n = std::uniform_int_distribution<int>(0, 3)(random); n > 0; --n) {
          const int dice = std::uniform_int_distribution<int>(0, 99)(random);
          const std::string tag = "c" + std::to_string(k) + "-" + std::to_string(++serial);
          const std::vector<std::string> cards = itemNames(c.contacts(), ".vcf");
          const std::vector<std::string> events = itemNames(c.calendars(), ".ics");
          if (dice < 14 || cards.empty()) {
            Computer::write(c.contacts() + "/" + tag + ".vcf", card(tag, tag));
            note({Edit::Add, Clock::now(), k, tag, "", ""});
            ++report.adds;
          } else if (dice < 18 || events.empty()) {
            Computer::write(c.calendars() + "/" + tag + ".ics", event(tag, tag));
            note({Edit::Add, Clock::now(), k, tag, "", ""});
            ++report.adds;
          } else if (dice < 68) {
            const std::string path = c.contacts() + "/" + pick(cards);
            const std::string field = kCardFields[random() % 4];
            const std::string uid = uidOf(Computer::read(path));
            if (uid.empty() || !setField(path, field, tag)) continue;
            note({Edit::Set, Clock::now(), k, uid, field, tag});
            ++report.edits;
          } else if (dice < 80) {
            const std::string path = c.calendars() + "/" + pick(events);
            const std::string field = kEventFields[random() % 2];
            const std::string uid = uidOf(Computer::read(path));
            if (uid.empty() || !setField(path, field, tag)) continue;
            note({Edit::Set, Clock::now(), k, uid, field, tag});
            ++report.edits;
          } else if (dice < 84) {
            // An exception of the series, a repeated property added.
            const std::string path = c.calendars() + "/" + pick(events);
            std::string content = Computer::read(path);
            const std::string uid = uidOf(content);
            const size_t at = content.find("SUMMARY:");
            if (uid.empty() || at == std::string::npos) continue;
            const std::string date = "202503" + std::to_string(10 + random() % 18) + "T100000Z";
            content.insert(at, "EXDATE:" + date + "\r\n");
            if (!save(path, content)) continue;
            note({Edit::Exception, Clock::now(), k, uid, "", date});
            ++report.edits;
          } else if (dice < 90) {
            const std::string name = pick(cards);
            const std::string uid = uidOf(Computer::read(c.contacts() + "/" + name));
            const std::string renamed = uid + "-" + tag + ".vcf";
            std::error_code error;
            std::filesystem::rename(c.contacts() + "/" + name, c.contacts() + "/" + renamed, error);
            if (error || uid.empty()) continue;
            note({Edit::Rename, Clock::now(), k, uid, "", renamed});
            ++report.renames;
          } else {
            const bool isEvent = dice >= 97;
            const std::string folder = isEvent ? c.calendars() : c.contacts();
            const std::string path = folder + "/" + pick(isEvent ? events : cards);
            const std::string uid = uidOf(Computer::read(path));
            std::error_code error;
            if (uid.empty() || !std::filesystem::remove(path, error)) continue;
            note({Edit::Delete, Clock::now(), k, uid, "", ""});
            ++report.deletes;
          }
        }
        const Computer::Result r = run(c, {"sync", "--max-delete", "100"});
        std::lock_guard<std::mutex> lock(mutex);
        ++report.syncs;
        if (r.status == 9 && fine(r)) ++report.leftOverSyncs;
        if (!fine(r)) ++report.failedSyncs;
        if (r.timedOut) report.problems.push_back(c.name() + "'s sync hung: " + r.err);
      }
    });
  }
  for (std::thread& t : loops) t.join();
  faulty.join();
  tell("the editing ended after " + std::to_string(report.syncs) + " syncs");

  // Quiet: every computer syncs in turn until nothing moves.
  for (int round = 0; round < 3; ++round)
    for (auto& c : computers) {
      Computer::Result r = run(*c, {"sync", "--max-delete", "100"});
      ++report.syncs;
      if (!fine(r)) {
        // With the computer's last words, from its log.
        std::istringstream lines(Computer::read(c->home() + "/Library/Logs/Sync/nubilosync.log"));
        std::vector<std::string> all;
        for (std::string line; std::getline(lines, line);) all.push_back(line);
        std::string tail;
        for (size_t i = all.size() > 12 ? all.size() - 12 : 0; i < all.size(); ++i)
          tail += "\n    " + all[i];
        report.problems.push_back(c->name() + " failed to sync once quiet: " + r.err + tail);
      }
    }
  tell("the computers synced until quiet");

  // Every computer holds the same files; the model is checked by UID.
  std::map<std::string, std::string> final = itemsByUid(computers[0]->contacts());
  const std::map<std::string, std::string> finalEvents = itemsByUid(computers[0]->calendars());
  report.cardsAtEnd = static_cast<int64_t>(final.size());
  report.eventsAtEnd = static_cast<int64_t>(finalEvents.size());
  for (auto& c : computers) {
    for (const auto& [mine, theirs] :
         {std::pair{Computer::files(c->contacts()), Computer::files(computers[0]->contacts())},
          std::pair{Computer::files(c->calendars()), Computer::files(computers[0]->calendars())}}) {
      if (mine == theirs) continue;
      std::string detail;
      int shown = 0;
      for (const auto& [name, content] : theirs) {
        auto other = mine.find(name);
        if (other != mine.end() && other->second == content) continue;
        if (shown++ < 3)
          detail += "\n    " + name + ": " + (other == mine.end() ? "(missing)" : other->second) +
                    " instead of " + content;
      }
      for (const auto& [name, content] : mine)
        if (!theirs.count(name) && shown++ < 6)
          detail += "\n    " + name + " only here: " + content;
      report.problems.push_back(c->name() + "'s folders differ from " + computers[0]->name() +
                                "'s" + detail);
    }
    report.lockWaits += lockWaits(*c);
    // Set aside until a compaction, which leaves it out, takes it off the share.
    if (c->run({"status"}).out.find("set aside evil.vcf (from Faulty Phone)") != std::string::npos)
      ++report.setAside;
  }
  for (const auto& [uid, content] : finalEvents) final[uid] = content;
  if (poisoned && !final.count("poisoned-good"))
    report.problems.push_back("lost: the good card sent beside the faulty record");
  if (poisoned && report.leftOverSyncs == 0)
    report.problems.push_back("no sync named the faulty record as set aside");
  std::set<std::string> lost;
  for (auto& c : computers)
    for (const std::string& value : lostValues(*c)) {
      lost.insert(value);
      ++report.conflicts;
    }

  // The model: every edit accounted for.
  std::map<std::string, Clock::time_point> lastDelete, lastSet;
  std::set<std::string> added;
  for (const Edit& e : edits) {
    if (e.kind == Edit::Delete) lastDelete[e.uid] = std::max(lastDelete[e.uid], e.when);
    if (e.kind != Edit::Delete && e.kind != Edit::Add)
      lastSet[e.uid] = std::max(lastSet[e.uid], e.when);
    if (e.kind == Edit::Add) added.insert(e.uid);
  }
  auto lostHas = [&](const std::string& uid, const std::string& field, const std::string& value) {
    for (const std::string& text : lost)
      if (text.starts_with(uid + " " + field + " ") && text.find(value) != std::string::npos)
        return true;
    return false;
  };
  // "EMAIL;TYPE=home" is kept as an EMAIL.
  auto property = [](const std::string& field) { return field.substr(0, field.find(';')); };
  for (const std::string& uid : added) {
    const bool deleted = lastDelete.count(uid);
    if (!deleted && !final.count(uid)) report.problems.push_back("lost: " + uid);
    if (deleted && final.count(uid) && !(lastSet.count(uid) && lastSet[uid] > lastDelete[uid]) &&
        !lostHas(uid, "(record)", "deleted"))
      report.problems.push_back("came back after its delete with no later edit: " + uid);
  }
  for (const Edit& e : edits) {
    if (e.kind != Edit::Set && e.kind != Edit::Exception) continue;
    auto now = final.find(e.uid);
    if (now == final.end()) {
      if (!lastDelete.count(e.uid))
        report.problems.push_back("lost with its item: " + e.uid + " " + e.field);
      continue;
    }
    if (e.kind == Edit::Exception) {
      if (now->second.find("EXDATE:" + e.value + "\r\n") == std::string::npos &&
          !lastDelete.count(e.uid))
        report.problems.push_back("lost: the exception " + e.value + " of " + e.uid);
      continue;
    }
    if (valueOf(now->second, e.field) == e.value) continue;
    bool overridden = false;
    for (const Edit& later : edits)
      overridden = overridden || (later.kind == Edit::Set && later.uid == e.uid &&
                                  later.field == e.field && later.when > e.when);
    const std::string line = e.field.substr(0, e.field.find('@')) + ":" + e.value + "\r\n";
    if (overridden || lostHas(e.uid, property(e.field), line) || lastDelete.count(e.uid)) continue;
    report.problems.push_back("lost: " + e.field + " " + e.value + " of " + e.uid);
  }
  // Nothing twice: every item's UID in one file only.
  for (const std::string& folder : {computers[0]->contacts(), computers[0]->calendars()}) {
    std::set<std::string> uids;
    for (const auto& [name, content] : Computer::files(folder))
      if (!uids.insert(uidOf(content)).second)
        report.problems.push_back("twice: " + uidOf(content) + " (" + name + ")");
  }

  if (!report.problems.empty() && !options.evidenceFolder.empty()) {
    namespace fs = std::filesystem;
    const fs::path folder = options.evidenceFolder;
    std::error_code error;
    fs::create_directories(folder, error);
    for (auto& c : computers)
      fs::copy(c->home(), folder / c->name(), fs::copy_options::recursive, error);
    fs::copy(share.documentRoot(), folder / "share", fs::copy_options::recursive, error);
    std::ostringstream log;
    for (const Edit& e : edits)
      log << std::chrono::duration<double>(e.when.time_since_epoch()).count() << ' '
          << "ASDRX"[e.kind] << ' ' << e.computer << ' ' << e.uid << ' ' << e.field << ' '
          << e.value << '\n';
    Computer::write((folder / "edits").string(), log.str());
    report.problems.push_back("the homes, the share and the edits are kept in " + folder.string());
  }
  return report;
}

}  // namespace vtc::local
