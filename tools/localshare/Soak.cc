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

#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "platform/plist/PlistCodec.h"

namespace vtc::local {

namespace {

using Clock = std::chrono::steady_clock;

struct Edit {
  enum Kind { Add, Set, Delete } kind;
  Clock::time_point when;
  int computer;
  std::string record;  // file name
  std::string field;   // "TEL" or "NOTE" for a Set
  std::string value;
};

std::string card(const std::string& uid, const std::string& tel, const std::string& note) {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + uid + "\r\nFN:Person " + uid + "\r\nTEL:" + tel +
         "\r\nNOTE:" + note + "\r\nEND:VCARD\r\n";
}

// The value of a property line ("TEL:..."), or "" when the card has none.
std::string field(const std::string& content, const std::string& name) {
  const std::string key = "\r\n" + name + ":";
  size_t at = content.find(key);
  if (at == std::string::npos) return "";
  at += key.size();
  return content.substr(at, content.find("\r\n", at) - at);
}

// Replaces a property's line, written the way an editor saves: a new file
// renamed over the old one.
bool setField(const std::string& path, const std::string& name, const std::string& value) {
  std::string content = Computer::read(path);
  const std::string key = "\r\n" + name + ":";
  size_t at = content.find(key);
  if (at == std::string::npos) return false;
  at += key.size();
  content.replace(at, content.find("\r\n", at) - at, value);
  const std::string temporary = std::filesystem::path(path).parent_path() / ".edit.tmp";
  Computer::write(temporary, content);
  std::error_code error;
  std::filesystem::rename(temporary, path, error);
  return !error;
}

std::vector<std::string> itemNames(const std::string& folder) {
  std::vector<std::string> names;
  for (const auto& [name, content] : Computer::files(folder))
    if (name.ends_with(".vcf")) names.push_back(name);
  return names;
}

// Every losing value kept on a computer: "file property lost", where a
// delete that lost is "(record) deleted".
std::vector<std::string> lostValues(const Computer& c) {
  std::vector<std::string> lost;
  std::error_code error;
  const std::string folder = c.home() + "/.local/share/NubiloSyncClient/Conflicts";
  for (auto it = std::filesystem::directory_iterator(folder, error);
       !error && it != std::filesystem::directory_iterator(); it.increment(error))
    if (auto kept = plist::readFile(it->path().string())) {
      const Dictionary& d = kept->dictionary();
      // The property of a field's key ("TEL#1f3a09c2" is a TEL).
      std::string property = d.get("Field").string();
      property = property.substr(property.rfind('/') + 1);
      property = property.substr(0, property.find('#'));
      const Value& value = d.get("Lost");
      std::string text = value.isString() ? value.string() : "deleted";
      if (value.kind() == Value::Kind::Data) text.assign(value.data().begin(), value.data().end());
      lost.push_back(d.get("File").string() + " " + property + " " + text);
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
    const std::string name = "s" + std::to_string(i) + ".vcf";
    Computer::write(computers[0]->contacts() + "/" + name,
                    card("s" + std::to_string(i), "start", "start"));
    edits.push_back({Edit::Add, Clock::now(), 0, name, "", ""});
  }
  for (auto& c : computers) run(*c, {"sync"});
  tell("the computers joined and took in the first cards");

  const auto deadline = Clock::now() + std::chrono::duration_cast<Clock::duration>(
                                           std::chrono::duration<double>(options.seconds));
  std::vector<std::thread> loops;
  for (int k = 0; k < options.computers; ++k) {
    loops.emplace_back([&, k] {
      const Computer& c = *computers[k];
      std::mt19937 random(options.seed * 7919 + static_cast<unsigned>(k));
      int serial = 0;
      while (Clock::now() < deadline) {
        for (int n = std::uniform_int_distribution<int>(0, 3)(random); n > 0; --n) {
          const int dice = std::uniform_int_distribution<int>(0, 99)(random);
          const std::string tag = "c" + std::to_string(k) + "-" + std::to_string(++serial);
          std::vector<std::string> names = itemNames(c.contacts());
          if (dice < 20 || names.empty()) {
            const std::string name = tag + ".vcf";
            Computer::write(c.contacts() + "/" + name, card(tag, tag, tag));
            std::lock_guard<std::mutex> lock(mutex);
            edits.push_back({Edit::Add, Clock::now(), k, name, "", ""});
            ++report.adds;
          } else if (dice < 88) {
            const std::string& name = names[random() % names.size()];
            const std::string which = dice % 2 ? "TEL" : "NOTE";
            if (!setField(c.contacts() + "/" + name, which, tag)) continue;
            std::lock_guard<std::mutex> lock(mutex);
            edits.push_back({Edit::Set, Clock::now(), k, name, which, tag});
            ++report.edits;
          } else {
            const std::string& name = names[random() % names.size()];
            std::error_code error;
            if (!std::filesystem::remove(c.contacts() + "/" + name, error)) continue;
            std::lock_guard<std::mutex> lock(mutex);
            edits.push_back({Edit::Delete, Clock::now(), k, name, "", ""});
            ++report.deletes;
          }
        }
        const Computer::Result r = run(c, {"sync", "--max-delete", "100"});
        std::lock_guard<std::mutex> lock(mutex);
        ++report.syncs;
        if (r.status != 0) ++report.failedSyncs;
        if (r.timedOut) report.problems.push_back(c.name() + "'s sync hung: " + r.err);
      }
    });
  }
  for (std::thread& t : loops) t.join();
  tell("the editing ended after " + std::to_string(report.syncs) + " syncs");

  // Quiet: every computer syncs in turn until nothing moves.
  for (int round = 0; round < 3; ++round)
    for (auto& c : computers) {
      Computer::Result r = run(*c, {"sync", "--max-delete", "100"});
      ++report.syncs;
      if (r.status != 0) {
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
  const auto final = Computer::files(computers[0]->contacts());
  report.cardsAtEnd = static_cast<int64_t>(final.size());
  for (auto& c : computers) {
    const auto mine = Computer::files(c->contacts());
    if (mine != final) {
      std::string detail;
      int shown = 0;
      for (const auto& [name, content] : final) {
        auto other = mine.find(name);
        if (other != mine.end() && other->second == content) continue;
        if (shown++ < 3)
          detail += "\n    " + name + ": " + (other == mine.end() ? "(missing)" : other->second) +
                    " instead of " + content;
      }
      for (const auto& [name, content] : mine)
        if (!final.count(name) && shown++ < 6) detail += "\n    " + name + " only here: " + content;
      report.problems.push_back(c->name() + "'s address book differs from " + computers[0]->name() +
                                "'s" + detail);
    }
    report.lockWaits += lockWaits(*c);
  }
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
    if (e.kind == Edit::Delete) lastDelete[e.record] = std::max(lastDelete[e.record], e.when);
    if (e.kind == Edit::Set) lastSet[e.record] = std::max(lastSet[e.record], e.when);
    if (e.kind == Edit::Add) added.insert(e.record);
  }
  auto lostHas = [&](const std::string& record, const std::string& fieldName,
                     const std::string& value) {
    for (const std::string& text : lost)
      if (text.starts_with(record + " " + fieldName + " ") && text.find(value) != std::string::npos)
        return true;
    return false;
  };
  for (const std::string& name : added) {
    const bool deleted = lastDelete.count(name);
    if (!deleted && !final.count(name)) report.problems.push_back("lost: " + name);
    if (deleted && final.count(name) &&
        !(lastSet.count(name) && lastSet[name] > lastDelete[name]) &&
        !lostHas(name, "(record)", "deleted"))
      report.problems.push_back("came back after its delete with no later edit: " + name);
  }
  for (const Edit& e : edits) {
    if (e.kind != Edit::Set) continue;
    auto now = final.find(e.record);
    if (now == final.end()) {
      if (!lastDelete.count(e.record))
        report.problems.push_back("lost with its record: " + e.record + " " + e.field);
      continue;
    }
    if (field(now->second, e.field) == e.value) continue;
    bool overridden = false;
    for (const Edit& later : edits)
      overridden = overridden || (later.kind == Edit::Set && later.record == e.record &&
                                  later.field == e.field && later.when > e.when);
    if (overridden || lostHas(e.record, e.field, e.field + ":" + e.value + "\r\n") ||
        lastDelete.count(e.record))
      continue;
    report.problems.push_back("lost: " + e.field + " " + e.value + " of " + e.record);
  }
  // Nothing twice: every card's UID once.
  std::set<std::string> uids;
  for (const auto& [name, content] : final)
    if (!uids.insert(field(content, "UID")).second)
      report.problems.push_back("twice: " + field(content, "UID"));

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
          << "ASD"[e.kind] << ' ' << e.computer << ' ' << e.record << ' ' << e.field << ' '
          << e.value << '\n';
    Computer::write((folder / "edits").string(), log.str());
    report.problems.push_back("the homes, the share and the edits are kept in " + folder.string());
  }
  return report;
}

}  // namespace vtc::local
