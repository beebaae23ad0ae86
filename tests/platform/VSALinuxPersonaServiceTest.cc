#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "VSATestTempDir.h"
#include "base/VSAPlist.h"
#include "platform/VSAAuditToken.h"
#include "platform/VSALinuxPersonaService.h"

namespace {

using namespace std::chrono_literals;

class PersonaFiles : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    std::filesystem::create_directories(root_ + "/etc/vessad");
    std::filesystem::create_directories(root_ + "/run/vessad/process-personas");
  }
  void write(const VSAValue& v) {
    VSAErrorRef error;
    auto bytes = VSAPlist::serialize(v, VSAPlist::Format::XML, &error);
    ASSERT_TRUE(VSAWriteFileAtomically(root_ + "/etc/vessad/personas.plist", *bytes, 0644, &error));
  }
  static VSAValue record(uint64_t id, const char* kind, VSAValue unique) {
    VSAValue r = VSAValue::Dictionary{{"PersonaID", VSAValue(id)}, {"Kind", VSAValue(kind)}};
    if (!unique.isNull()) r.set("UniqueString", unique);
    return r;
  }
  VSATestTempDir temp_{"vessa-personas"};
  std::string root_;
};

TEST_F(PersonaFiles, MissingFileMeansOnePersonalPersona) {
  VSALinuxPersonaService service{VSASystemRoot(root_)};
  auto list = service.listPersonas();
  ASSERT_TRUE(list);
  ASSERT_EQ(list->size(), 1u);
  EXPECT_TRUE(list->front().isPersonal());
  EXPECT_EQ(*list->front().uniqueString, kVSADefaultPersonalPersonaString);
}

TEST_F(PersonaFiles, MalformedRecordsAreLeftOutAndGarbageGivesNoList) {
  VSAValue enterprise = record(2, "enterprise", VSAValue("E"));
  enterprise.set("BundleIdentifiers", VSAValue(VSAValue::Array{VSAValue("com.a")}));
  enterprise.set("LayoutPath", VSAValue("/private/var/e"));
  VSAValue badApps = record(3, "enterprise", VSAValue("F"));
  badApps.set("BundleIdentifiers", VSAValue(VSAValue::Array{VSAValue(1)}));
  write(VSAValue::Array{record(1, "personal", VSAValue("P")), enterprise, badApps,
                        record(4, "alien", VSAValue("X")), record(5, "system", VSAValue(7)),
                        VSAValue("not a record"),
                        VSAValue(VSAValue::Dictionary{{"Kind", VSAValue("universal")}})});
  VSALinuxPersonaService service{VSASystemRoot(root_)};
  auto list = service.listPersonas();
  ASSERT_TRUE(list);
  ASSERT_EQ(list->size(), 2u);
  EXPECT_EQ(list->at(1).personaID, 2u);
  EXPECT_EQ(*list->at(1).layoutPath, root_ + "/private/var/e");
  std::ofstream(root_ + "/etc/vessad/personas.plist") << "<plist><dict>";
  EXPECT_FALSE(service.listPersonas());
}

TEST_F(PersonaFiles, CurrentPersonaComesFromTheServedProcessRecord) {
  write(
      VSAValue::Dictionary{{"Personas", VSAValue::Array{record(1, "personal", VSAValue("P")),
                                                        record(2, "enterprise", VSAValue("E"))}}});
  VSALinuxPersonaService service{VSASystemRoot(root_)};
  EXPECT_FALSE(service.currentPersona()) << "a thread serving nobody has no persona";
  uint64_t start = VSAAuditToken::processStartTime(getpid());
  {
    VSACurrentPersonaScope scope(getpid(), start);
    EXPECT_EQ(service.currentPersona()->personaID, 1u) << "no record: personal";
    std::ofstream(service.processRecordPath(getpid())) << start << " 2\n";
    EXPECT_EQ(service.currentPersona()->personaID, 2u);
  }
  {
    // A record written for an earlier process with the same pid is stale.
    VSACurrentPersonaScope scope(getpid(), start + 1);
    EXPECT_EQ(service.currentPersona()->personaID, 1u);
  }
  EXPECT_FALSE(VSACurrentPersonaScope::current());
}

// Served through a connection's memo, the record is read by the first
// request only: the connection keeps the persona its client had when it was
// first served, and a new connection reads the record again.
TEST_F(PersonaFiles, ConnectionMemoReadsTheRecordOnce) {
  write(
      VSAValue::Dictionary{{"Personas", VSAValue::Array{record(1, "personal", VSAValue("P")),
                                                        record(2, "enterprise", VSAValue("E"))}}});
  VSALinuxPersonaService service{VSASystemRoot(root_)};
  uint64_t start = VSAAuditToken::processStartTime(getpid());
  VSAPersonaRecordMemo first;
  {
    VSACurrentPersonaScope scope(getpid(), start, &first);
    EXPECT_EQ(service.currentPersona()->personaID, 1u) << "no record yet: personal";
  }
  std::ofstream(service.processRecordPath(getpid())) << start << " 2\n";
  {
    VSACurrentPersonaScope scope(getpid(), start, &first);
    EXPECT_EQ(service.currentPersona()->personaID, 1u) << "the absent record is remembered";
    EXPECT_EQ(VSACurrentPersonaScope::currentMemo(), &first);
  }
  VSAPersonaRecordMemo second;
  {
    VSACurrentPersonaScope scope(getpid(), start, &second);
    EXPECT_EQ(service.currentPersona()->personaID, 2u) << "a new connection reads it";
    std::filesystem::remove(service.processRecordPath(getpid()));
    EXPECT_EQ(service.currentPersona()->personaID, 2u);
    {
      VSACurrentPersonaScope inner(getpid(), start);  // no memo: read every time
      EXPECT_EQ(service.currentPersona()->personaID, 1u);
      EXPECT_EQ(VSACurrentPersonaScope::currentMemo(), nullptr);
    }
    EXPECT_EQ(VSACurrentPersonaScope::currentMemo(), &second) << "scopes nest";
  }
  EXPECT_EQ(VSACurrentPersonaScope::currentMemo(), nullptr);
}

// The parsed list is kept between calls; every way of changing the file
// (atomic replacement with a same-sized text, removal) is seen at once.
TEST_F(PersonaFiles, KeptListFollowsEveryChangeOfTheFile) {
  VSALinuxPersonaService service{VSASystemRoot(root_)};
  write(VSAValue::Array{record(1, "personal", VSAValue("P")),
                        record(2, "enterprise", VSAValue("E"))});
  ASSERT_EQ(service.listPersonas()->at(1).personaID, 2u);
  ASSERT_EQ(service.listPersonas()->at(1).personaID, 2u) << "answered from the kept list";
  write(VSAValue::Array{record(1, "personal", VSAValue("P")),
                        record(3, "enterprise", VSAValue("E"))});
  EXPECT_EQ(service.listPersonas()->at(1).personaID, 3u);
  std::filesystem::remove(root_ + "/etc/vessad/personas.plist");
  ASSERT_EQ(service.listPersonas()->size(), 1u) << "back to the default personal persona";
  EXPECT_EQ(*service.listPersonas()->front().uniqueString, kVSADefaultPersonalPersonaString);
}

// A process record counts only as a regular file owned by root: a link or
// another user's file could be planted to move a process into a persona.
TEST_F(PersonaFiles, ProcessRecordMustBeARootOwnedRegularFile) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to own the record";
  write(VSAValue::Array{record(1, "personal", VSAValue("P")),
                        record(2, "enterprise", VSAValue("E"))});
  VSALinuxPersonaService service{VSASystemRoot(root_)};
  uint64_t start = VSAAuditToken::processStartTime(getpid());
  std::string record = service.processRecordPath(getpid());
  std::string planted = root_ + "/planted";
  std::ofstream(planted) << start << " 2\n";
  std::filesystem::create_symlink(planted, record);
  EXPECT_FALSE(service.recordedPersonaID(getpid(), start)) << "a symbolic link";
  std::filesystem::remove(record);
  std::ofstream(record) << start << " 2\n";
  ASSERT_EQ(chown(record.c_str(), 501, 501), 0);
  EXPECT_FALSE(service.recordedPersonaID(getpid(), start)) << "not owned by root";
  ASSERT_EQ(chown(record.c_str(), 0, 0), 0);
  EXPECT_EQ(service.recordedPersonaID(getpid(), start), 2u);
  std::ofstream(record) << "garbage";
  EXPECT_FALSE(service.recordedPersonaID(getpid(), start));
}

TEST_F(PersonaFiles, ProcessRecordIsReadWithoutBlockingAndWithinItsLimit) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to own the record";
  write(VSAValue::Array{record(1, "personal", VSAValue("P")),
                        record(2, "enterprise", VSAValue("E"))});
  VSALinuxPersonaService service{VSASystemRoot(root_)};
  uint64_t start = VSAAuditToken::processStartTime(getpid());
  std::string record = service.processRecordPath(getpid());
  // A FIFO in place of the record: opening it must not wait for a writer.
  ASSERT_EQ(::mkfifo(record.c_str(), 0644), 0);
  auto read =
      std::async(std::launch::async, [&] { return service.recordedPersonaID(getpid(), start); });
  if (read.wait_for(20s) != std::future_status::ready) {
    ADD_FAILURE() << "reading a FIFO record blocked";
    int w = ::open(record.c_str(), O_WRONLY | O_NONBLOCK);  // let the reader go
    if (w >= 0) ::close(w);
  }
  EXPECT_FALSE(read.get());
  std::filesystem::remove(record);
  // A record that starts right but runs past the limit was not written by
  // the launcher.
  std::ofstream(record) << start << " 2\n" << std::string(4096, ' ');
  EXPECT_FALSE(service.recordedPersonaID(getpid(), start));
  std::ofstream(record, std::ios::trunc) << start << " 2\n";
  EXPECT_EQ(service.recordedPersonaID(getpid(), start), 2u);
}

TEST_F(PersonaFiles, ObserverHearsFileChanges) {
  VSALinuxPersonaService service{VSASystemRoot(root_)};
  std::atomic<int> changes{0};
  std::atomic<bool> registered{false};
  service.registerObserver(
      "test.personaobserver", [&] { ++changes; }, [&](VSAErrorRef e) { registered = !e; });
  write(VSAValue::Array{record(1, "personal", VSAValue("P"))});
  for (int i = 0; i < 200 && changes == 0; ++i) std::this_thread::sleep_for(5ms);
  EXPECT_TRUE(registered);
  EXPECT_GE(changes.load(), 1);
}

// With a watch up the kept list is used without looking at the file; a
// change reaches the observer only after the list was let go, and a watch
// that lost its directory still lets a change through within seconds.
TEST_F(PersonaFiles, WatchedListIsNeverOlderThanWhatTheObserverHeard) {
  VSALinuxPersonaService service{VSASystemRoot(root_)};
  write(VSAValue::Array{record(1, "personal", VSAValue("P"))});
  std::atomic<int> changes{0};
  std::promise<bool> started;
  service.registerObserver(
      "test.personawatch", [&] { ++changes; }, [&](VSAErrorRef e) { started.set_value(!e); });
  ASSERT_TRUE(started.get_future().get());
  ASSERT_EQ(service.listPersonas()->size(), 1u);
  for (uint64_t id = 2; id <= 4; ++id) {
    int before = changes;
    write(VSAValue::Array{record(1, "personal", VSAValue("P")),
                          record(id, "enterprise", VSAValue("E"))});
    for (int i = 0; i < 400 && changes == before; ++i) std::this_thread::sleep_for(5ms);
    ASSERT_GT(changes.load(), before) << "the watch reported nothing";
    auto list = service.listPersonas();
    ASSERT_TRUE(list && list->size() == 2u);
    EXPECT_EQ(list->at(1).personaID, id) << "the observer heard of a change the list missed";
  }
  // The watched directory is moved away and a new one takes its place.
  std::filesystem::rename(root_ + "/etc/vessad", root_ + "/etc/vessad.old");
  std::filesystem::create_directories(root_ + "/etc/vessad");
  write(VSAValue::Array{record(9, "personal", VSAValue("P9"))});
  std::optional<std::vector<VSAPersonaAttributes>> list;
  for (int i = 0; i < 600; ++i) {
    list = service.listPersonas();
    if (list && list->front().personaID == 9u) break;
    std::this_thread::sleep_for(5ms);
  }
  ASSERT_TRUE(list);
  EXPECT_EQ(list->front().personaID, 9u) << "a lost watch must not keep the old list for ever";
}

}  // namespace
