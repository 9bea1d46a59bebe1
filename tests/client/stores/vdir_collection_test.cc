// vdir folders: what a scan reads and reports, and writes that never lose
// what another program put on disk.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <stdexcept>

#include "client/stores/ItemFiles.h"
#include "client/stores/VdirCollection.h"
#include "common/Logging.h"
#include "platform/prefs/PreferenceStore.h"
#include "support/TestHome.h"

namespace {

using vtc::client::ItemKind;
using vtc::client::ItemState;
using vtc::client::ScanResult;
using vtc::client::VdirCollection;
using vtc::client::WriteOutcome;
namespace fs = std::filesystem;

std::string card(const std::string& name, const std::string& extra = "") {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nFN:" + name + "\r\n" + extra + "END:VCARD\r\n";
}

class VdirFolder : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  std::string folder = home.path() + "/contacts";
  VdirCollection store{folder, ItemKind::Contacts};

  void SetUp() override { fs::create_directory(folder); }

  // What another program does: plain writes, in place.
  void put(const std::string& name, const std::string& bytes) {
    std::ofstream(folder + "/" + name, std::ios::binary | std::ios::trunc) << bytes;
  }
  std::string contents(const std::string& name) { return store.read(name).value_or("(none)"); }
  // Gives a file another modification time, as an editor that keeps the size would.
  void touch(const std::string& name, int seconds) {
    struct timespec times[2] = {{seconds, 0}, {seconds, 0}};
    ASSERT_EQ(::utimensat(AT_FDCWD, (folder + "/" + name).c_str(), times, 0), 0);
  }
  std::vector<std::string> folderEntries() {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(folder))
      names.push_back(entry.path().filename());
    std::sort(names.begin(), names.end());
    return names;
  }
  ItemState written(const std::string& name, const std::string& bytes) {
    ItemState state;
    EXPECT_EQ(store.write(name, bytes, std::nullopt, &state), WriteOutcome::Written);
    return state;
  }
};

std::vector<std::string> keysOf(const ScanResult& scan) {
  std::vector<std::string> keys;
  for (const auto& [key, value] : scan.read) keys.push_back(key);
  return keys;
}

std::vector<std::string> invalidNames(const ScanResult& scan) {
  std::vector<std::string> names;
  for (const auto& [name, why] : scan.invalid) names.push_back(name);
  return names;
}

TEST_F(VdirFolder, ScanReadsOnlyFilesWhoseStampsChanged) {
  put("a.vcf", card("Ada"));
  put("b.vcf", card("Grace"));
  put("c.vcf", card("Edsger"));
  // Not items: the user's files, hidden files, other extensions, folders.
  put("displayname", "Friends");
  put("color", "#ff0000");
  put(".a.vcf.tmp", "partial");
  put(".hidden.vcf", card("Hidden"));
  put("notes.txt", "x");
  fs::create_directory(folder + "/folder.vcf");

  ScanResult first = store.scan({});
  EXPECT_EQ(keysOf(first), (std::vector<std::string>{"a.vcf", "b.vcf", "c.vcf"}));
  EXPECT_EQ(first.read["b.vcf"]->text.units[2].raw, "FN:Grace\r\n");
  EXPECT_EQ(first.filesRead, 3u);
  EXPECT_EQ(first.states.size(), 3u);

  ScanResult again = store.scan(first.states);
  EXPECT_TRUE(again.read.empty() && again.deleted.empty());
  EXPECT_EQ(again.filesRead, 0u);
  EXPECT_EQ(again.states, first.states);

  put("b.vcf", card("Grace Hopper"));  // a field changed
  touch("c.vcf", 1000000);             // only the time changed
  fs::remove(folder + "/a.vcf");
  ScanResult third = store.scan(first.states);
  EXPECT_EQ(keysOf(third), (std::vector<std::string>{"b.vcf", "c.vcf"}));
  EXPECT_EQ(third.deleted, (std::vector<std::string>{"a.vcf"}));
  EXPECT_EQ(third.filesRead, 2u);
  EXPECT_EQ(third.states.at("c.vcf").modifiedNanoseconds, 1000000 * 1000000000LL);
  EXPECT_EQ(store.scan(third.states).filesRead, 0u);
}

TEST_F(VdirFolder, InvalidFilesAreSkippedWithAWarningNeverDeletedAndComeBackWhenFixed) {
  vtc::prefs::PreferenceStore::shared().setValue(
      "LoggingLevel", vtc::Value("warn"), "com.korvo.VantorSync", vtc::prefs::Scope::AnyHost);
  ASSERT_TRUE(vtc::prefs::PreferenceStore::shared().synchronize("com.korvo.VantorSync",
                                                                vtc::prefs::Scope::AnyHost));
  vtc::log::resetForTesting();
  put("known.vcf", card("Ada"));
  ScanResult first = store.scan({});

  put("known.vcf", card("Ada") + card("Second"));  // two vCards in one file
  put("broken.vcf", "BEGIN:VCARD\r\nFN:no end\r\n");
  ScanResult scan = store.scan(first.states);
  EXPECT_EQ(invalidNames(scan), (std::vector<std::string>{"broken.vcf", "known.vcf"}));
  EXPECT_EQ(scan.invalid[0].second, "there is no END:VCARD");
  EXPECT_EQ(scan.invalid[1].second, "there is more after END:VCARD");
  EXPECT_TRUE(scan.read.empty() && scan.deleted.empty());
  // The known item stays known as it was.
  EXPECT_EQ(scan.states, first.states);

  std::ifstream log(vtc::log::logFilePath());
  std::string text((std::istreambuf_iterator<char>(log)), std::istreambuf_iterator<char>());
  for (const char* name : {"/broken.vcf", "/known.vcf"}) {
    size_t at = text.find(folder + name);
    ASSERT_NE(at, std::string::npos) << text;
    EXPECT_NE(text.rfind("|Warning|", at), std::string::npos);
  }

  put("known.vcf", card("Ada Lovelace"));
  scan = store.scan(scan.states);
  EXPECT_EQ(keysOf(scan), (std::vector<std::string>{"known.vcf"}));
  EXPECT_EQ(invalidNames(scan), (std::vector<std::string>{"broken.vcf"}));
}

TEST_F(VdirFolder, AMissingFolderRaisesInsteadOfLookingEmpty) {
  put("a.vcf", card("Ada"));
  ScanResult known = store.scan({});
  fs::remove_all(folder);
  EXPECT_FALSE(store.exists());
  try {
    store.scan(known.states);
    ADD_FAILURE() << "no exception";
  } catch (const std::runtime_error& e) {
    EXPECT_EQ(std::string(e.what()), "The folder " + folder + " does not exist.");
  }
  put("../contacts", "a file now");
  EXPECT_THROW(store.scan(known.states), std::runtime_error);
}

TEST_F(VdirFolder, WritesAreAtomicAndTheirStateIsWhatTheNextScanSees) {
  ItemState state = written("new.vcf", card("Ada"));
  EXPECT_EQ(store.scan({{"new.vcf", state}}).filesRead, 0u);
  EXPECT_EQ(fs::status(folder + "/new.vcf").permissions(), fs::perms(0600));

  // A replacement keeps the mode the user gave the file.
  fs::permissions(folder + "/new.vcf", fs::perms(0644));
  state = store.scan({}).states.at("new.vcf");
  ItemState next;
  EXPECT_EQ(store.write("new.vcf", card("Ada Lovelace"), state, &next), WriteOutcome::Written);
  EXPECT_EQ(contents("new.vcf"), card("Ada Lovelace"));
  EXPECT_NE(next.inode, state.inode);
  EXPECT_EQ(fs::status(folder + "/new.vcf").permissions(), fs::perms(0644));
  EXPECT_EQ(store.scan({{"new.vcf", next}}).filesRead, 0u);
  EXPECT_EQ(folderEntries(), (std::vector<std::string>{"new.vcf"}));  // no temporary left

  // Bytes that are no item are not written; names outside the folder or
  // of another kind are refused.
  EXPECT_EQ(store.write("bad.vcf", "FN:x\r\n", std::nullopt, &state), WriteOutcome::Failed);
  for (const char* name : {"../x.vcf", ".hidden.vcf", "x.ics", "sub/x.vcf"})
    EXPECT_THROW(store.write(name, card("x"), std::nullopt, &state), std::invalid_argument) << name;
  EXPECT_EQ(folderEntries(), (std::vector<std::string>{"new.vcf"}));
}

TEST_F(VdirFolder, FilesChangedSinceTheyWereReadAreNeverOverwrittenOrRemoved) {
  ItemState state = written("a.vcf", card("Ada"));

  put("a.vcf", card("Ada, edited elsewhere"));  // between scan and write
  EXPECT_EQ(store.write("a.vcf", card("Ada, from the sync"), state, nullptr),
            WriteOutcome::SkippedChangedOnDisk);
  EXPECT_EQ(store.remove("a.vcf", state), WriteOutcome::SkippedChangedOnDisk);
  EXPECT_EQ(contents("a.vcf"), card("Ada, edited elsewhere"));

  // The same size and bytes, but touched: still not ours to overwrite.
  state = store.scan({}).states.at("a.vcf");
  touch("a.vcf", 2000000);
  EXPECT_EQ(store.write("a.vcf", card("Ada, from the sync"), state, nullptr),
            WriteOutcome::SkippedChangedOnDisk);

  // A new item whose name has appeared meanwhile.
  put("b.vcf", card("Grace, made here"));
  EXPECT_EQ(store.write("b.vcf", card("Grace, from the sync"), std::nullopt, nullptr),
            WriteOutcome::SkippedChangedOnDisk);
  EXPECT_EQ(contents("b.vcf"), card("Grace, made here"));

  // Should the name appear in the instant between that check and the
  // rename, the rename still does not replace it.
  put(".temporary", card("Grace, from the sync"));
  vtc::client::FileDescriptor dir(::open(folder.c_str(), O_RDONLY | O_DIRECTORY));
  EXPECT_FALSE(vtc::client::placeNewFile(dir.get(), ".temporary", "b.vcf"));
  EXPECT_EQ(errno, EEXIST);
  EXPECT_EQ(contents("b.vcf"), card("Grace, made here"));
  EXPECT_TRUE(vtc::client::placeNewFile(dir.get(), ".temporary", "c.vcf"));
  EXPECT_EQ(contents("c.vcf"), card("Grace, from the sync"));

  // A removal of the file as it was read; a file already gone counts as removed.
  state = store.scan({}).states.at("a.vcf");
  EXPECT_EQ(store.remove("a.vcf", state), WriteOutcome::Removed);
  EXPECT_EQ(store.remove("a.vcf", state), WriteOutcome::Removed);
  EXPECT_EQ(folderEntries(), (std::vector<std::string>{"b.vcf", "c.vcf"}));
}

TEST_F(VdirFolder, AThousandUnchangedFilesScanInWellUnderTenMilliseconds) {
  std::map<std::string, ItemState> known;
  std::string extra = "EMAIL:someone@example.org\r\nTEL:+1 555 0100\r\nNOTE:a short note\r\n";
  for (int i = 0; i < 1000; ++i)
    put("item" + std::to_string(i) + ".vcf", card("Person " + std::to_string(i), extra));
  known = store.scan({}).states;
  ASSERT_EQ(known.size(), 1000u);
  auto fastest = std::chrono::nanoseconds::max();
  for (int run = 0; run < 5; ++run) {
    auto start = std::chrono::steady_clock::now();
    ScanResult scan = store.scan(known);
    fastest = std::min(fastest, std::chrono::steady_clock::now() - start);
    ASSERT_EQ(scan.filesRead, 0u);
  }
  EXPECT_LT(fastest, std::chrono::milliseconds(10));
  RecordProperty(
      "fastest_scan_microseconds",
      std::to_string(std::chrono::duration_cast<std::chrono::microseconds>(fastest).count()));
}

}  // namespace
