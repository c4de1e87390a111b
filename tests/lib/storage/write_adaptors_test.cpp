#include "lib/storage/write_adaptors.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <limits>
#include <memory>
#include <mutex>
#include <optional>
#include <ostream>
#include <regex>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "fake_mount_commands.h"
#include "files.h"
#include "lib/storage/dual_file_target.h"
#include "lib/util/log.h"
#include "scratch_dir.h"
#include "slot_changes_refused.h"
#include "store_files.h"

namespace {

namespace fs = std::filesystem;
using Storage::DualFileTarget;
using Storage::PartitionWriteAdaptor;
using Storage::SlotHandle;
using Storage::TargetSlot;
using Storage::TargetWriteAdaptor;
using store_test::Bytes;
using store_test::bytesOf;
using testing_support::ProcessResult;
using Lines = std::vector<std::string>;

// One O_APPEND write per line, so that lines of the fake mount, the test
// and its threads never mix.
void appendLine(const fs::path& path, const std::string& line) {
    const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666);
    if (fd < 0) throw std::runtime_error("cannot open " + path.string());
    const std::string text = line + "\n";
    const ssize_t written = ::write(fd, text.data(), text.size());
    ::close(fd);
    if (written != static_cast<ssize_t>(text.size())) throw std::runtime_error("cannot write " + path.string());
}

Lines splitLines(const std::string& text) {
    Lines lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) lines.push_back(line);
    return lines;
}

Lines readLines(const fs::path& path) {
    if (!fs::exists(path)) return {};
    return splitLines(testing_support::readText(path));
}

std::string shellQuoted(const std::string& text) {
    std::string quoted = "'";
    for (const char c : text) quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
    return quoted + "'";
}

// Error lines carry "<source>:<line> "; the line number is replaced by "N"
// so that expectations do not move with the source.
Lines maskedOutput(const std::string& out) {
    static const std::regex prefix("^lib/storage/write_adaptors:[1-9][0-9]* ");
    Lines lines = splitLines(out);
    for (auto& line : lines) line = std::regex_replace(line, prefix, "lib/storage/write_adaptors:N ");
    return lines;
}

std::string failedToSet(const std::string& quotedMountPoint, bool writable) {
    return "lib/storage/write_adaptors:N Failed to set " + quotedMountPoint + " to " +
           (writable ? "writable" : "not writable");
}

std::string notActiveWarning(size_t index) {
    return "WriteAdaptor: index " + std::to_string(index) + " was finalised, but doesn't appear to be active";
}

std::string statusLine(const std::string& what, Status status) { return what + " -> " + std::to_string(status); }

// A slot that appends every call to the events file and answers all of
// them with one status; the inner calls thus appear in one sequence with
// the remount commands.
class EventSlot : public TargetSlot {
public:
    EventSlot(fs::path events, size_t index, Status result)
        : events_(std::move(events)), name_("slot " + std::to_string(index)), result_(result) {}
    ~EventSlot() override { appendLine(events_, name_ + " destroyed"); }

    bool exists() const override {
        appendLine(events_, name_ + " exists");
        return true;
    }
    bool isValid() const override {
        appendLine(events_, name_ + " isValid");
        return false;
    }
    Status beginWrite() override { return record("beginWrite"); }
    Status finalise() override { return record("finalise"); }
    Status write(const uint8_t*, size_t size) override { return record("write " + std::to_string(size)); }
    Status writeAt(int64_t offset, const uint8_t*, size_t size) override {
        return record("writeAt " + std::to_string(offset) + " " + std::to_string(size));
    }
    Status read(uint8_t*, size_t, int64_t) override { return record("read"); }
    Status readSome(uint8_t*, size_t, int64_t, size_t& bytesRead) override {
        bytesRead = 0;
        return record("readSome");
    }
    Status erase() override { return record("erase"); }

private:
    Status record(const std::string& call) {
        appendLine(events_, name_ + " " + call);
        return result_;
    }

    fs::path events_;
    std::string name_;
    Status result_;
};

// One EventSlot per entry of `results`, answering with that status.
class EventTarget : public Storage::Target {
public:
    EventTarget(fs::path events, const std::vector<Status>& results) : events_(std::move(events)) {
        for (size_t index = 0; index < results.size(); ++index)
            slots_.push_back(std::make_unique<EventSlot>(events_, index, results[index]));
    }
    ~EventTarget() override {
        for (auto& slot : slots_) slot.reset();
        appendLine(events_, "target destroyed");
    }

    SlotHandle getSlot(size_t index) override {
        return index < slots_.size() ? SlotHandle::borrow(slots_[index].get()) : SlotHandle();
    }
    size_t getSlotCount() const override { return slots_.size(); }
    std::string getDescription() const override { return "EventTarget " + events_.string(); }

private:
    fs::path events_;
    std::vector<std::unique_ptr<EventSlot>> slots_;
};

// The generic layer alone, with every hook recorded.
class RecordingWriteAdaptor : public TargetWriteAdaptor<EventTarget> {
public:
    RecordingWriteAdaptor(const fs::path& events, const std::vector<Status>& results)
        : TargetWriteAdaptor<EventTarget>(events, results), events_(events) {}

protected:
    void writeStarted(size_t index) override { record("writeStarted", index); }
    void writeEnded(size_t index) override { record("writeEnded", index); }

private:
    void onRemoveAllSlots() override { appendLine(events_, "onRemoveAllSlots"); }
    void beforeModify(size_t index) override { record("beforeModify", index); }
    void afterModify(size_t index) override { record("afterModify", index); }
    void record(const std::string& hook, size_t index) { appendLine(events_, hook + " " + std::to_string(index)); }

    fs::path events_;
};

// ---- TargetWriteAdaptor ----

class TargetWriteAdaptorTest : public ::testing::Test {
protected:
    Lines events() const { return readLines(eventsPath); }

    testing_support::ScratchDir dir;
    const fs::path eventsPath = dir / "events";
    const Bytes blob = bytesOf("blob");
};

TEST_F(TargetWriteAdaptorTest, ForwardsCountAndDescription) {
    RecordingWriteAdaptor adaptor(eventsPath, {STATUS_OK, STATUS_OK, STATUS_OK});
    EXPECT_EQ(adaptor.getSlotCount(), 3u);
    EXPECT_EQ(adaptor.getDescription(), "EventTarget " + eventsPath.string());
    EXPECT_TRUE(events().empty());

    PartitionWriteAdaptor<DualFileTarget> store(dir / "partition", dir / "store", 26);
    EXPECT_EQ(store.getSlotCount(), 26u);
    EXPECT_EQ(store.getDescription(), "DualFileTarget " + (dir / "store").string());
}

TEST_F(TargetWriteAdaptorTest, GetSlotBeyondTheCountIsNull) {
    RecordingWriteAdaptor adaptor(eventsPath, {STATUS_OK, STATUS_OK});
    for (const size_t index : {size_t{2}, size_t{3}, std::numeric_limits<size_t>::max()}) {
        SlotHandle handle = adaptor.getSlot(index);
        EXPECT_FALSE(handle) << index;
        EXPECT_EQ(handle.get(), nullptr) << index;
        EXPECT_FALSE(handle.ownsSlot()) << index;
    }
    EXPECT_TRUE(events().empty());
}

// The handle owns a fresh adaptor; releasing it leaves the target's own
// slot alive and serving the next handle.
TEST_F(TargetWriteAdaptorTest, GetSlotHandsOutAnOwnedAdaptor) {
    {
        RecordingWriteAdaptor adaptor(eventsPath, {STATUS_OK, STATUS_FAILED});
        SlotHandle first = adaptor.getSlot(1);
        ASSERT_TRUE(first);
        EXPECT_TRUE(first.ownsSlot());
        EXPECT_NE(dynamic_cast<Storage::TargetSlotAdaptor*>(first.get()), nullptr);
        SlotHandle second = adaptor.getSlot(1);
        ASSERT_TRUE(second);
        EXPECT_NE(second.get(), first.get());
        EXPECT_EQ(first->write(blob.data(), blob.size()), STATUS_FAILED);
        first.reset();
        EXPECT_EQ(second->write(blob.data(), blob.size()), STATUS_FAILED);
        second.reset();
        SlotHandle third = adaptor.getSlot(1);
        ASSERT_TRUE(third);
        EXPECT_TRUE(third->exists());
        appendLine(eventsPath, "destroying adaptor");
    }
    EXPECT_EQ(events(), (Lines{"beforeModify 1", "slot 1 write 4", "afterModify 1", "beforeModify 1", "slot 1 write 4",
                               "afterModify 1", "slot 1 exists", "destroying adaptor", "slot 0 destroyed",
                               "slot 1 destroyed", "target destroyed"}));
}

TEST_F(TargetWriteAdaptorTest, IncrementalWritesReachWriteStartedAndWriteEnded) {
    RecordingWriteAdaptor adaptor(eventsPath, {STATUS_OK, STATUS_INVALID_OPERATION});
    SlotHandle slot = adaptor.getSlot(1);
    ASSERT_TRUE(slot);
    EXPECT_EQ(slot->beginWrite(), STATUS_INVALID_OPERATION);
    EXPECT_EQ(slot->writeAt(7, blob.data(), blob.size()), STATUS_INVALID_OPERATION);
    EXPECT_EQ(slot->finalise(), STATUS_INVALID_OPERATION);
    EXPECT_EQ(slot->erase(), STATUS_INVALID_OPERATION);
    EXPECT_EQ(events(),
              (Lines{"writeStarted 1", "slot 1 beginWrite", "beforeModify 1", "slot 1 writeAt 7 4", "afterModify 1",
                     "slot 1 finalise", "writeEnded 1", "beforeModify 1", "slot 1 erase", "afterModify 1"}));
}

TEST_F(TargetWriteAdaptorTest, ReadsAndQueriesAreNotWrites) {
    RecordingWriteAdaptor adaptor(eventsPath, {STATUS_NOT_FOUND});
    SlotHandle slot = adaptor.getSlot(0);
    ASSERT_TRUE(slot);
    uint8_t buffer[4] = {};
    size_t count = 9;
    EXPECT_EQ(slot->read(buffer, sizeof buffer, 0), STATUS_NOT_FOUND);
    EXPECT_EQ(slot->readSome(buffer, sizeof buffer, 0, count), STATUS_NOT_FOUND);
    EXPECT_EQ(count, 0u);
    EXPECT_TRUE(slot->exists());
    EXPECT_FALSE(slot->isValid());
    EXPECT_EQ(events(), (Lines{"slot 0 read", "slot 0 readSome", "slot 0 exists", "slot 0 isValid"}));
}

TEST_F(TargetWriteAdaptorTest, SkipTakesNoAction) {
    RecordingWriteAdaptor adaptor(eventsPath, {STATUS_OK});
    // The slot adaptor always passes skip false; the observer side is a
    // private base, reachable only by an explicit cast.
    auto& observer = (Storage::TargetSlotObserver&)adaptor;
    observer.onBeginWrite(0, true);
    observer.onFinalised(0, true);
    EXPECT_TRUE(events().empty());
    observer.onBeginWrite(0, false);
    observer.onFinalised(0, false);
    EXPECT_EQ(events(), (Lines{"writeStarted 0", "writeEnded 0"}));
}

TEST_F(TargetWriteAdaptorTest, RemoveAllSlotsNotifiesThenRefuses) {
    RecordingWriteAdaptor adaptor(eventsPath, {STATUS_OK, STATUS_OK});
    EXPECT_EQ(adaptor.removeAllSlots(), STATUS_NOT_IMPLEMENTED);
    EXPECT_EQ(events(), (Lines{"onRemoveAllSlots"}));
    store_test::expectSlotChangesRefused(adaptor, "x");
    EXPECT_EQ(adaptor.getSlotCount(), 2u);
    EXPECT_EQ(events(), (Lines{"onRemoveAllSlots"}));
}

// ---- PartitionWriteAdaptor with a recording `mount` ----

// The adaptor runs in a child whose PATH starts with a fake `mount`. Each
// invocation appends "mount " and its arguments as one line to the events
// file (with the number of arguments when it is not 3, and "+label" or
// "-label" for each watched file that exists or not at that moment), keeps
// its second argument ("remount,rw" or "remount,ro") in the state file as
// the partition's mode, and exits with the configured code. The test and
// the EventTarget append to the same events file, so the order of
// everything shows.
class PartitionWriteAdaptorTest : public ::testing::Test {
protected:
    struct Watched {
        std::string label;
        fs::path path;
    };

    void installFakeMount(int exitCode = 0, const std::vector<Watched>& watched = {}) {
        fs::create_directories(binDir);
        std::string script = "#!/bin/sh\nline=\"mount $*\"\n";
        script += "if [ $# -ne 3 ]; then line=\"$line [$# arguments]\"; fi\n";
        for (const auto& file : watched) {
            script += "if [ -e " + shellQuoted(file.path.string()) + " ]; then line=\"$line +" + file.label +
                      "\"; else line=\"$line -" + file.label + "\"; fi\n";
        }
        script += "printf '%s\\n' \"$line\" >>" + shellQuoted(eventsPath.string()) + "\n";
        script += "printf '%s\\n' \"$2\" >" + shellQuoted(statePath.string()) + "\n";
        script += "exit " + std::to_string(exitCode) + "\n";
        testing_support::writeText(binDir / "mount", script);
        fs::permissions(binDir / "mount", fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec |
                                              fs::perms::others_read | fs::perms::others_exec);
    }

    // Log lines go to the child's standard output; `threshold` as given.
    ProcessResult run(const std::function<void()>& body, int threshold = LOG_PRIORITY_WARNING) {
        return testing_support::runWithCommandsFirst(binDir, threshold, [&] {
            body();
            return 0;
        });
    }

    void note(const std::string& line) const { appendLine(eventsPath, line); }
    Lines events() const { return readLines(eventsPath); }
    std::string remount(const std::string& mode) const { return "mount -o remount," + mode + " " + mountPoint; }
    std::string quotedMountPoint() const { return "\"" + mountPoint + "\""; }

    static void expectCleanExit(const ProcessResult& result) {
        EXPECT_EQ(result.exitStatus, 0);
        EXPECT_EQ(result.signal, 0);
        EXPECT_EQ(result.err, "");
    }

    testing_support::ScratchDir dir;
    const fs::path binDir = dir / "bin";
    const fs::path eventsPath = dir / "events";
    const fs::path statePath = dir / "mount-state";
    const fs::path storePath = dir / "store";
    std::string mountPoint = (dir / "partition").string();
    const Bytes blob = bytesOf("new settings");
};

TEST_F(PartitionWriteAdaptorTest, OverlappingWritesOnTwoSlotsShareOneRemountPair) {
    installFakeMount();
    const Bytes blob0 = bytesOf("slot zero");
    const Bytes blob1 = bytesOf("slot one");
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<DualFileTarget> store(mountPoint, storePath, 2);
        SlotHandle slot0 = store.getSlot(0);
        SlotHandle slot1 = store.getSlot(1);
        note(statusLine("begin 0", slot0->beginWrite()));
        note(statusLine("begin 1", slot1->beginWrite()));
        note(statusLine("writeAt 0", slot0->writeAt(0, blob0.data(), blob0.size())));
        note(statusLine("writeAt 1", slot1->writeAt(0, blob1.data(), blob1.size())));
        note(statusLine("finalise 0", slot0->finalise()));
        note(statusLine("finalise 1", slot1->finalise()));
    });
    expectCleanExit(result);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(events(), (Lines{remount("rw"), "begin 0 -> 0", "begin 1 -> 0", "writeAt 0 -> 0", "writeAt 1 -> 0",
                               "finalise 0 -> 0", remount("ro"), "finalise 1 -> 0"}));
    DualFileTarget reopened(storePath, 2);
    EXPECT_EQ(store_test::contentOf(*reopened.getSlot(0).get()), store_test::holding(blob0));
    EXPECT_EQ(store_test::contentOf(*reopened.getSlot(1).get()), store_test::holding(blob1));
}

// Each single-call modification is bracketed: the store's files are
// untouched at the "rw" remount and committed at the "ro" one.
struct SingleCallCase {
    std::string name;
    std::function<Status(TargetSlot&, const Bytes&)> call;
    std::string filesAfter;  // watched files at the "ro" remount
    store_test::SlotContent contentAfter;
};

void PrintTo(const SingleCallCase& row, std::ostream* out) { *out << row.name; }

class SingleCallTest : public PartitionWriteAdaptorTest, public ::testing::WithParamInterface<SingleCallCase> {};

TEST_P(SingleCallTest, RemountsAroundTheCall) {
    const SingleCallCase& row = GetParam();
    // A fresh store writes into copy 1, "2/data".
    installFakeMount(
        0, {{"data", storePath / "2/data"}, {"chk", storePath / "2/data.chk"}, {"tmp", storePath / "2/data.chk.tmp"}});
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<DualFileTarget> store(mountPoint, storePath, 1);
        SlotHandle slot = store.getSlot(0);
        note("calling " + row.name);
        note(statusLine(row.name, row.call(*slot.get(), blob)));
        note("releasing the adaptor");
    });
    expectCleanExit(result);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(events(), (Lines{"calling " + row.name, remount("rw") + " -data -chk -tmp",
                               remount("ro") + " " + row.filesAfter, row.name + " -> 0", "releasing the adaptor"}));
    DualFileTarget reopened(storePath, 1);
    EXPECT_EQ(store_test::contentOf(*reopened.getSlot(0).get()), row.contentAfter);
}

INSTANTIATE_TEST_SUITE_P(
    Calls, SingleCallTest,
    ::testing::Values(
        SingleCallCase{"write",
                       [](TargetSlot& slot, const Bytes& data) { return slot.write(data.data(), data.size()); },
                       "+data +chk -tmp", store_test::holding(bytesOf("new settings"))},
        SingleCallCase{"writeAt",
                       [](TargetSlot& slot, const Bytes& data) { return slot.writeAt(2, data.data(), data.size()); },
                       "+data +chk -tmp", store_test::holding(bytesOf(std::string(2, '\0') + "new settings"))},
        SingleCallCase{"erase", [](TargetSlot& slot, const Bytes&) { return slot.erase(); }, "-data +chk -tmp",
                       store_test::absentBlob()}),
    [](const ::testing::TestParamInfo<SingleCallCase>& info) { return info.param.name; });

TEST_F(PartitionWriteAdaptorTest, FinalisingWithoutBeginWarnsAndDoesNotRemount) {
    installFakeMount();
    const ProcessResult result = run([&] {
        {
            PartitionWriteAdaptor<DualFileTarget> store(mountPoint, storePath, 3);
            note(statusLine("finalise 2", store.getSlot(2)->finalise()));
            note(statusLine("finalise 0", store.getSlot(0)->finalise()));
        }
        note("adaptor destroyed");
    });
    expectCleanExit(result);
    EXPECT_EQ(splitLines(result.out), (Lines{notActiveWarning(2), notActiveWarning(0)}));
    EXPECT_EQ(events(), (Lines{"finalise 2 -> 95", "finalise 0 -> 95", "adaptor destroyed"}));
}

// The remount comes before the inner beginWrite, so it happens even when
// that fails; without a finalise the slot stays active, across other
// writes, until the adaptor goes, after its target.
TEST_F(PartitionWriteAdaptorTest, FailedBeginWriteKeepsThePartitionWritableUntilDestruction) {
    installFakeMount();
    const ProcessResult result = run([&] {
        {
            PartitionWriteAdaptor<EventTarget> store(mountPoint, eventsPath, std::vector<Status>{5, STATUS_OK});
            note(statusLine("begin 0", store.getSlot(0)->beginWrite()));
            note(statusLine("write 1", store.getSlot(1)->write(blob.data(), blob.size())));
            note(statusLine("erase 0", store.getSlot(0)->erase()));
            note("destroying adaptor");
        }
        note("adaptor destroyed");
    });
    expectCleanExit(result);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(events(), (Lines{remount("rw"), "slot 0 beginWrite", "begin 0 -> 5", "slot 1 write 12", "write 1 -> 0",
                               "slot 0 erase", "erase 0 -> 5", "destroying adaptor", "slot 0 destroyed",
                               "slot 1 destroyed", "target destroyed", remount("ro"), "adaptor destroyed"}));
}

// The same with the real store: a beginWrite that cannot remove the
// pending copy ("2" is a file, not a directory) fails with ENOTDIR.
TEST_F(PartitionWriteAdaptorTest, FailedBeginWriteOnTheStoreStillRemounts) {
    installFakeMount();
    fs::create_directories(storePath);
    testing_support::writeText(storePath / "2", "not a directory");
    const ProcessResult result = run([&] {
        {
            PartitionWriteAdaptor<DualFileTarget> store(mountPoint, storePath, 1);
            note(statusLine("begin 0", store.getSlot(0)->beginWrite()));
            note("destroying adaptor");
        }
        note("adaptor destroyed");
    });
    expectCleanExit(result);
    // Opening the store already trips over the file.
    EXPECT_EQ(splitLines(result.out), (Lines{"lib/storage/storage_target:334 Failure cleaning up checkfile \"" +
                                             (storePath / "2/data.chk").string() + "\""}));
    EXPECT_EQ(events(),
              (Lines{remount("rw"), "begin 0 -> 20", "destroying adaptor", remount("ro"), "adaptor destroyed"}));
}

TEST_F(PartitionWriteAdaptorTest, DestroyingTheAdaptorDuringAWriteRemountsReadOnly) {
    installFakeMount();
    const ProcessResult result = run([&] {
        {
            PartitionWriteAdaptor<EventTarget> store(mountPoint, eventsPath, std::vector<Status>{STATUS_OK});
            SlotHandle slot = store.getSlot(0);
            note(statusLine("begin 0", slot->beginWrite()));
            note(statusLine("writeAt 0", slot->writeAt(3, blob.data(), blob.size())));
            slot.reset();
            note("destroying adaptor");
        }
        note("adaptor destroyed");
    });
    expectCleanExit(result);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(events(), (Lines{remount("rw"), "slot 0 beginWrite", "begin 0 -> 0", "slot 0 writeAt 3 12",
                               "writeAt 0 -> 0", "destroying adaptor", "slot 0 destroyed", "target destroyed",
                               remount("ro"), "adaptor destroyed"}));
}

TEST_F(PartitionWriteAdaptorTest, DestroyingAnIdleAdaptorDoesNotRemount) {
    installFakeMount();
    const ProcessResult result = run([&] {
        {
            PartitionWriteAdaptor<EventTarget> store(mountPoint, eventsPath, std::vector<Status>{STATUS_OK});
            note(statusLine("write 0", store.getSlot(0)->write(blob.data(), blob.size())));
            note("destroying adaptor");
        }
        note("adaptor destroyed");
    });
    expectCleanExit(result);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(events(), (Lines{remount("rw"), "slot 0 write 12", remount("ro"), "write 0 -> 0", "destroying adaptor",
                               "slot 0 destroyed", "target destroyed", "adaptor destroyed"}));
}

TEST_F(PartitionWriteAdaptorTest, NestedStartsOnOneSlotAreCounted) {
    installFakeMount();
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<EventTarget> store(mountPoint, eventsPath, std::vector<Status>{STATUS_OK});
        SlotHandle slot = store.getSlot(0);
        note(statusLine("begin", slot->beginWrite()));
        note(statusLine("begin", slot->beginWrite()));
        note(statusLine("write", slot->write(blob.data(), blob.size())));
        note(statusLine("finalise", slot->finalise()));
        note(statusLine("finalise", slot->finalise()));
        note(statusLine("finalise", slot->finalise()));
    });
    expectCleanExit(result);
    EXPECT_EQ(splitLines(result.out), (Lines{notActiveWarning(0)}));
    EXPECT_EQ(events(), (Lines{remount("rw"), "slot 0 beginWrite", "begin -> 0", "slot 0 beginWrite", "begin -> 0",
                               "slot 0 write 12", "write -> 0", "slot 0 finalise", "finalise -> 0", "slot 0 finalise",
                               remount("ro"), "finalise -> 0", "slot 0 finalise", "finalise -> 0", "slot 0 destroyed",
                               "target destroyed"}));
}

TEST_F(PartitionWriteAdaptorTest, ReadsAndQueriesDoNotRemount) {
    installFakeMount();
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<EventTarget> store(mountPoint, eventsPath, std::vector<Status>{STATUS_OK});
        SlotHandle slot = store.getSlot(0);
        uint8_t buffer[4] = {};
        size_t count = 0;
        note(statusLine("read", slot->read(buffer, sizeof buffer, 0)));
        note(statusLine("readSome", slot->readSome(buffer, sizeof buffer, 0, count)));
        note(std::string("exists ") + (slot->exists() ? "true" : "false"));
        note(std::string("isValid ") + (slot->isValid() ? "true" : "false"));
    });
    expectCleanExit(result);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(events(),
              (Lines{"slot 0 read", "read -> 0", "slot 0 readSome", "readSome -> 0", "slot 0 exists", "exists true",
                     "slot 0 isValid", "isValid false", "slot 0 destroyed", "target destroyed"}));
}

TEST_F(PartitionWriteAdaptorTest, RemoveAllSlotsRefusesWithoutRemount) {
    installFakeMount();
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<EventTarget> store(mountPoint, eventsPath, std::vector<Status>{STATUS_OK, STATUS_OK});
        note(statusLine("removeAllSlots", store.removeAllSlots()));
        note("count " + std::to_string(store.getSlotCount()));
        note(std::string("slot 2 ") + (store.getSlot(2) ? "present" : "null"));
    });
    expectCleanExit(result);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(events(), (Lines{"removeAllSlots -> 38", "count 2", "slot 2 null", "slot 0 destroyed", "slot 1 destroyed",
                               "target destroyed"}));
}

// The same over the dual-file store, as the registry builds it: its blobs
// stay where they are.
TEST_F(PartitionWriteAdaptorTest, RemoveAllSlotsOfADualFileStoreRefusesWithoutRemount) {
    installFakeMount();
    {
        DualFileTarget target(storePath, 2);
        ASSERT_EQ(target.getSlot(1)->write(blob.data(), blob.size()), STATUS_OK);
    }
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<DualFileTarget> store(mountPoint, storePath, 2);
        note(statusLine("removeAllSlots", store.removeAllSlots()));
        note("count " + std::to_string(store.getSlotCount()));
    });
    expectCleanExit(result);
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(events(), (Lines{"removeAllSlots -> 38", "count 2"}));
    DualFileTarget reopened(storePath, 2);
    EXPECT_EQ(store_test::contentOf(*reopened.getSlot(0).get()), store_test::nothingStored());
    EXPECT_EQ(store_test::contentOf(*reopened.getSlot(1).get()), store_test::holding(blob));
}

// A failed remount is logged and the slot operation goes on with its own
// status; the next transition is tried all the same.
class FailingRemountTest : public PartitionWriteAdaptorTest, public ::testing::WithParamInterface<Status> {};

TEST_P(FailingRemountTest, IsLoggedAndTheWriteGoesOn) {
    const Status inner = GetParam();
    installFakeMount(1);
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<EventTarget> store(mountPoint, eventsPath, std::vector<Status>{inner});
        note(statusLine("write", store.getSlot(0)->write(blob.data(), blob.size())));
        note(statusLine("erase", store.getSlot(0)->erase()));
    });
    expectCleanExit(result);
    EXPECT_EQ(maskedOutput(result.out),
              (Lines{failedToSet(quotedMountPoint(), true), failedToSet(quotedMountPoint(), false),
                     failedToSet(quotedMountPoint(), true), failedToSet(quotedMountPoint(), false)}));
    const std::string status = std::to_string(inner);
    EXPECT_EQ(events(),
              (Lines{remount("rw"), "slot 0 write 12", remount("ro"), "write -> " + status, remount("rw"),
                     "slot 0 erase", remount("ro"), "erase -> " + status, "slot 0 destroyed", "target destroyed"}));
}

INSTANTIATE_TEST_SUITE_P(InnerStatuses, FailingRemountTest, ::testing::Values(STATUS_OK, Status{30}));

// A failed remount while the adaptor goes away is logged too.
TEST_F(PartitionWriteAdaptorTest, FailingRemountAtDestructionIsLogged) {
    installFakeMount(1);
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<EventTarget> store(mountPoint, eventsPath, std::vector<Status>{STATUS_OK});
        note(statusLine("begin", store.getSlot(0)->beginWrite()));
    });
    expectCleanExit(result);
    EXPECT_EQ(maskedOutput(result.out),
              (Lines{failedToSet(quotedMountPoint(), true), failedToSet(quotedMountPoint(), false)}));
    EXPECT_EQ(events(), (Lines{remount("rw"), "slot 0 beginWrite", "begin -> 0", "slot 0 destroyed", "target destroyed",
                               remount("ro")}));
}

TEST_F(PartitionWriteAdaptorTest, ThresholdDecidesWhatIsLogged) {
    installFakeMount(1);
    const auto body = [&] {
        PartitionWriteAdaptor<EventTarget> store(mountPoint, eventsPath, std::vector<Status>{STATUS_OK});
        (void)store.getSlot(0)->finalise();  // only the warning matters
        (void)store.getSlot(0)->erase();     // only the failing remounts matter
    };
    const ProcessResult errorsOnly = run(body, LOG_PRIORITY_ERROR);
    expectCleanExit(errorsOnly);
    EXPECT_EQ(maskedOutput(errorsOnly.out),
              (Lines{failedToSet(quotedMountPoint(), true), failedToSet(quotedMountPoint(), false)}));
    const ProcessResult critical = run(body, LOG_PRIORITY_CRITICAL);
    expectCleanExit(critical);
    EXPECT_EQ(critical.out, "");
    // Logging or not, the commands ran each time.
    EXPECT_EQ(events(), (Lines{"slot 0 finalise", remount("rw"), "slot 0 erase", remount("ro"), "slot 0 destroyed",
                               "target destroyed", "slot 0 finalise", remount("rw"), "slot 0 erase", remount("ro"),
                               "slot 0 destroyed", "target destroyed"}));
}

// The mount point goes to the shell as it stands, while the message quotes
// it as std::quoted does.
struct QuotingCase {
    std::string name;
    std::string mountPointName;            // below the scratch directory
    std::optional<std::string> shellSees;  // the argument the shell hands to mount; none: the shell fails
    std::string quotedInMessage;           // between the quotes of the message
};

void PrintTo(const QuotingCase& row, std::ostream* out) { *out << row.name; }

class MountPointQuotingTest : public PartitionWriteAdaptorTest, public ::testing::WithParamInterface<QuotingCase> {};

TEST_P(MountPointQuotingTest, CommandUnescapedMessageEscaped) {
    const QuotingCase& row = GetParam();
    mountPoint = (dir / row.mountPointName).string();
    installFakeMount(1);
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<EventTarget> store(mountPoint, eventsPath, std::vector<Status>{STATUS_OK});
        note(statusLine("write", store.getSlot(0)->write(blob.data(), blob.size())));
    });
    EXPECT_EQ(result.exitStatus, 0);
    EXPECT_EQ(result.signal, 0);
    const std::string quoted = "\"" + dir.path().string() + "/" + row.quotedInMessage + "\"";
    EXPECT_EQ(maskedOutput(result.out), (Lines{failedToSet(quoted, true), failedToSet(quoted, false)}));
    Lines expected;
    const std::string shellSees = dir.path().string() + "/" + row.shellSees.value_or("");
    if (row.shellSees) expected.push_back("mount -o remount,rw " + shellSees);
    expected.push_back("slot 0 write 12");
    if (row.shellSees) expected.push_back("mount -o remount,ro " + shellSees);
    expected.insert(expected.end(), {"write -> 0", "slot 0 destroyed", "target destroyed"});
    EXPECT_EQ(events(), expected);
    if (row.shellSees) {
        EXPECT_EQ(result.err, "");
    }
}

INSTANTIATE_TEST_SUITE_P(
    MountPoints, MountPointQuotingTest,
    ::testing::Values(QuotingCase{"Plain", "partition", "partition", "partition"},
                      QuotingCase{"PairOfQuotes", "part\"it\"ion", "partition", "part\\\"it\\\"ion"},
                      QuotingCase{"Backslash", "back\\slash", "backslash", "back\\\\slash"},
                      QuotingCase{"QuotedBlank", "two\" \"words", "two words", "two\\\" \\\"words"},
                      QuotingCase{"LoneQuote", "lone\"quote", std::nullopt, "lone\\\"quote"}),
    [](const ::testing::TestParamInfo<QuotingCase>& info) { return info.param.name; });

// ---- two threads on one adaptor ----

class Barrier {
public:
    explicit Barrier(unsigned parties) : parties_(parties) {}
    void wait() {
        std::unique_lock<std::mutex> lock(mutex_);
        const unsigned generation = generation_;
        if (++waiting_ == parties_) {
            waiting_ = 0;
            ++generation_;
            changed_.notify_all();
            return;
        }
        changed_.wait(lock, [&] { return generation_ != generation; });
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    const unsigned parties_;
    unsigned waiting_ = 0;
    unsigned generation_ = 0;
};

// Both threads begin at once and both writes are begun before either ends,
// so every round is one overlap: one "rw" when the first begins, one "ro"
// when the last ends, whichever thread comes first.
TEST_F(PartitionWriteAdaptorTest, TwoThreadsOnDifferentSlotsShareTheRemounts) {
    constexpr int kRounds = 100;
    installFakeMount();
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<DualFileTarget> store(mountPoint, storePath, 2);
        Barrier barrier(2);
        std::atomic<int> failures{0};
        const auto writer = [&](size_t index) {
            for (int round = 0; round < kRounds; ++round) {
                const Bytes data = bytesOf("slot " + std::to_string(index) + " round " + std::to_string(round));
                SlotHandle slot = store.getSlot(index);
                barrier.wait();
                if (slot->beginWrite() != STATUS_OK) ++failures;
                barrier.wait();
                if (slot->writeAt(0, data.data(), data.size()) != STATUS_OK) ++failures;
                if (slot->finalise() != STATUS_OK) ++failures;
                if (store_test::contentOf(*slot.get()) != store_test::holding(data)) ++failures;
                barrier.wait();
            }
        };
        std::thread first(writer, 0);
        std::thread second(writer, 1);
        first.join();
        second.join();
        std::printf("failures: %d\n", failures.load());
    });
    expectCleanExit(result);
    EXPECT_EQ(result.out, "failures: 0\n");
    Lines expected;
    for (int round = 0; round < kRounds; ++round) {
        expected.push_back(remount("rw"));
        expected.push_back(remount("ro"));
    }
    EXPECT_EQ(events(), expected);
    DualFileTarget reopened(storePath, 2);
    const std::string last = " round " + std::to_string(kRounds - 1);
    EXPECT_EQ(store_test::contentOf(*reopened.getSlot(0).get()), store_test::holding(bytesOf("slot 0" + last)));
    EXPECT_EQ(store_test::contentOf(*reopened.getSlot(1).get()), store_test::holding(bytesOf("slot 1" + last)));
}

// Without any pacing, one thread's last release (and its "ro" remount)
// meets the other's first start again and again; the partition must be in
// "rw" mode whenever a write is begun, and the modes must alternate.
TEST_F(PartitionWriteAdaptorTest, FreeRunningThreadsNeverWriteOnAReadOnlyPartition) {
    constexpr int kIterations = 200;
    installFakeMount();
    const ProcessResult result = run([&] {
        PartitionWriteAdaptor<DualFileTarget> store(mountPoint, storePath, 2);
        std::atomic<int> failures{0};
        std::atomic<int> readOnlyWhileWriting{0};
        const auto writer = [&](size_t index) {
            for (int iteration = 0; iteration < kIterations; ++iteration) {
                const Bytes data = bytesOf("slot " + std::to_string(index) + " #" + std::to_string(iteration));
                SlotHandle slot = store.getSlot(index);
                if (slot->beginWrite() != STATUS_OK) ++failures;
                if (testing_support::readText(statePath) != "remount,rw\n") ++readOnlyWhileWriting;
                if (slot->writeAt(0, data.data(), data.size()) != STATUS_OK) ++failures;
                if (slot->finalise() != STATUS_OK) ++failures;
            }
        };
        std::thread first(writer, 0);
        std::thread second(writer, 1);
        first.join();
        second.join();
        std::printf("failures: %d, read-only while writing: %d\n", failures.load(), readOnlyWhileWriting.load());
    });
    expectCleanExit(result);
    EXPECT_EQ(result.out, "failures: 0, read-only while writing: 0\n");
    const Lines remounts = events();
    ASSERT_FALSE(remounts.empty());
    EXPECT_EQ(remounts.size() % 2, 0u);
    for (size_t i = 0; i < remounts.size(); ++i) ASSERT_EQ(remounts[i], remount(i % 2 == 0 ? "rw" : "ro")) << i;
    EXPECT_EQ(testing_support::readText(statePath), "remount,ro\n");
    DualFileTarget reopened(storePath, 2);
    const std::string last = " #" + std::to_string(kIterations - 1);
    EXPECT_EQ(store_test::contentOf(*reopened.getSlot(0).get()), store_test::holding(bytesOf("slot 0" + last)));
    EXPECT_EQ(store_test::contentOf(*reopened.getSlot(1).get()), store_test::holding(bytesOf("slot 1" + last)));
}

}  // namespace
