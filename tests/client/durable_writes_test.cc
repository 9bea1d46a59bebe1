// The order that makes a sync's writes survive a power cut, shown without
// pulling the plug. The real sync runs in this process against a real
// share; its folder's files go through a layer that knows what the disk
// holds. At every step the engine (a second connection) may name only
// files that are durable; then the power is cut after each step in turn,
// the folder put back to what was durable, and the next sync must lose
// nothing, send nothing and keep no conflict.
#include <gmock/gmock.h>

#include <filesystem>
#include <optional>

#include "client/run/DataclassSync.h"
#include "client/run/ServerView.h"
#include "localshare/Computer.h"
#include "platform/engine/SyncEngine.h"
#include "support/PowerCutFiles.h"
#include "support/ShareTest.h"

using vtc::local::Computer;
using vtc::test::PowerCutFiles;

namespace vtc::client {
namespace {

constexpr const char* kContacts = "com.korvo.Contacts";

std::string card(const std::string& uid, const std::string& tel) {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + uid + "\r\nFN:Person " + uid + "\r\nTEL:" + tel +
         "\r\nEND:VCARD\r\n";
}

class DurableWrites : public vtc::test::ShareTest {
 protected:
  Computer b{"Mac B"};
  const std::string folder = home.path() + "/contacts";
  const std::string database = home.path() + "/engine.sqlite";
  std::unique_ptr<NubiloRemoteSession> session = openSession(Dictionary{{"guid", "GUID-A"},
                                                                        {"ClientGuid", "GUID-A"},
                                                                        {"ClientName", "Mac A"},
                                                                        {"sync_path", "/sync"}});
  ConflictStore conflicts{home.path() + "/Conflicts"};

  void SetUp() override {
    b.join(share.url("/sync"), local::Share::kUser, local::Share::kPassword);
    std::filesystem::create_directories(folder);
  }

  // A sync of A's folder, as a run of the client makes it.
  DataclassOutcome syncA() {
    auto engine = engine::SyncEngine::open(database);
    HeldLocks locks(*session);
    SyncOptions options;
    options.computerName = "Mac A";
    DataclassSync sync(*session, *engine, Collection{kContacts, ItemKind::Contacts, folder},
                       options, conflicts, locks);
    return sync.run(ServerView::read(*session).record(kContacts));
  }
  void syncB() {
    Computer::Result r = b.run({"sync"});
    EXPECT_EQ(r.status, 0) << r.err;
  }

  // The engine names no file the disk might not hold: a file the sync wrote
  // is recorded only once its entry and its bytes are durable, and a file
  // it removed is forgotten only once the removal is.
  void expectEngineBehindDisk(const PowerCutFiles& files, const std::string& when) {
    auto engine = engine::SyncEngine::open(database);
    const auto stamps = engine->itemStamps(folderClient(kContacts), kContacts);
    const auto durable = files.durable();
    for (const auto& [name, stamp] : stamps) {
      if (!files.created(stamp.inode)) continue;  // read, not written by a sync
      auto entry = durable.find(name);
      EXPECT_TRUE(entry != durable.end() && entry->second.inode == stamp.inode &&
                  entry->second.bytes &&
                  static_cast<int64_t>(entry->second.bytes->size()) == stamp.size)
          << name << " is recorded as written before it is on the disk, " << when;
    }
    for (const std::string& name : files.removed()) {
      if (stamps.count(name)) continue;
      EXPECT_EQ(durable.count(name), 0u)
          << name << " is forgotten before its removal is on the disk, " << when;
    }
  }
};

TEST_F(DurableWrites, NothingIsRecordedBeforeItIsDurableAndAPowerCutAtAnyStepLosesNothing) {
  for (int i = 0; i < 4; ++i)
    Computer::write(b.contacts() + "/p" + std::to_string(i) + ".vcf",
                    card("p" + std::to_string(i), "1"));
  syncB();
  PowerCutFiles files(folder);
  files.beforeEach = [&](const PowerCutFiles::Event& e) {
    expectEngineBehindDisk(files, "before " + e.operation + " " + e.name);
  };
  syncA();
  expectEngineBehindDisk(files, "after the first sync");
  EXPECT_EQ(Computer::files(folder), Computer::files(b.contacts()));

  // Each round B edits a card and adds one; A's sync loses its power
  // before its first step, then before its second, and so on, and at last
  // after its final flush; the folder is put back to what was durable, and
  // the next sync must find it all again.
  std::optional<size_t> steps;  // of a whole sync, once one ran to its end
  for (size_t cut = 0; !steps || cut <= *steps + 1; ++cut) {
    const std::string added = "n" + std::to_string(cut);
    Computer::write(b.contacts() + "/p0.vcf", card("p0", std::to_string(100 + cut)));
    Computer::write(b.contacts() + "/" + added + ".vcf", card(added, "1"));
    syncB();
    files.clearEvents();
    if (steps)
      files.cutAfter(*steps - 1);
    else
      files.cutBefore(cut);
    try {
      syncA();
      steps = files.events().size();
      continue;
    } catch (const PowerCutFiles::PowerCut&) {
    }
    const std::string step = files.events().size() == cut
                                 ? "with a power cut before step " + std::to_string(cut)
                                 : "with a power cut after the last step";
    files.restoreDurable();
    const DataclassOutcome next = syncA();
    EXPECT_EQ(next.sentChanges, 0u) << step;
    EXPECT_EQ(next.conflicts, 0u) << step;
    EXPECT_EQ(Computer::files(folder), Computer::files(b.contacts())) << step;
  }
  EXPECT_EQ(steps, 7u);

  // A whole sync: its writes and removals, then one flush for all of them.
  Computer::write(b.contacts() + "/p0.vcf", card("p0", "200"));
  std::filesystem::remove(b.contacts() + "/n0.vcf");
  Computer::write(b.contacts() + "/m.vcf", card("m", "1"));
  syncB();
  files.clearEvents();
  syncA();
  std::vector<std::string> operations;
  for (const auto& e : files.events()) operations.push_back(e.operation);
  EXPECT_THAT(operations, testing::ElementsAre("create", "write", "rename new", "unlink", "create",
                                               "write", "rename", "sync all"));
  expectEngineBehindDisk(files, "at the end");
  EXPECT_EQ(Computer::files(folder), Computer::files(b.contacts()));
}

}  // namespace
}  // namespace vtc::client
