// The built inspect_store run as a child process over stores written through
// DualFileTarget and damaged by hand: every state and reason in plain and
// JSON output (parsed here), exit statuses, --dump bytes, planted entries,
// the command line, and agreement with a freshly opened store. Every run
// must leave the whole scratch tree exactly as it was.
#include <sys/stat.h>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <functional>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "fault_injection.h"
#include "files.h"
#include "hostile_tree.h"
#include "json_value.h"
#include "lib/storage/dual_file_target.h"
#include "scratch_dir.h"
#include "store_files.h"
#include "tool_run.h"

namespace {

namespace fs = std::filesystem;
using testing_support::JsonValue;
using testing_support::ProcessResult;
using testing_support::readBytes;
using testing_support::writeBytes;

const store_test::Bytes kFirst = store_test::patternBytes(300, 1);
const store_test::Bytes kLater = store_test::patternBytes(200, 2);

// Runs inspect_store and checks that nothing below `root` changed but the
// dump files in "out".
ProcessResult inspect(const fs::path& root, const std::vector<std::string>& args,
                      const testing_support::Environment& env = {}) {
    const auto snapshotTree = [](const fs::path& tree) { return testing_support::snapshotTree(tree, {"out"}); };
    const std::string before = snapshotTree(root);
    std::vector<std::string> argv = {e2e::kInspectStore};
    argv.insert(argv.end(), args.begin(), args.end());
    const ProcessResult result = testing_support::runProgram(argv, env, e2e::kRunTimeLimitSeconds);
    EXPECT_EQ(result.signal, 0) << "ended by signal " << result.signal << e2e::describe(args);
    EXPECT_EQ(snapshotTree(root), before) << "inspect_store changed the tree:" << e2e::describe(args);
    return result;
}

std::vector<std::string> linesOf(const std::string& text) {
    std::vector<std::string> lines;
    size_t start = 0;
    for (size_t end = text.find('\n'); end != std::string::npos; start = end + 1, end = text.find('\n', start)) {
        lines.push_back(text.substr(start, end - start));
    }
    return lines;
}

JsonValue parsed(const ProcessResult& result) {
    try {
        return testing_support::parseJson(result.out);
    } catch (const std::exception& error) {
        ADD_FAILURE() << error.what() << "\n" << result.out;
        return JsonValue();
    }
}

// A store target as the registry places it.
struct Target {
    const char* name;
    const char* location;
    size_t slots;
};
const Target kSettings = {"settings", "settings", 1};
const Target kLut = {"lut", "app/luts", 26};

fs::path slotDirectory(const fs::path& base, const Target& target, size_t index) {
    const fs::path path = base / target.location;
    return target.slots == 1 ? path : path / std::to_string(index);
}

// Opens the target through the store and runs `body` on one slot.
void withSlot(const fs::path& base, const Target& target, size_t index,
              const std::function<void(Storage::TargetSlot&)>& body) {
    Storage::DualFileTarget store(base / target.location, target.slots);
    Storage::SlotHandle handle = store.getSlot(index);
    body(*handle.get());
}

// kFirst into copy 2, then kLater into copy 1, which becomes current.
void twoWrites(const fs::path& base, const Target& target, size_t index) {
    withSlot(base, target, index, [](Storage::TargetSlot& slot) {
        ASSERT_EQ(slot.write(kFirst.data(), kFirst.size()), STATUS_OK);
        ASSERT_EQ(slot.write(kLater.data(), kLater.size()), STATUS_OK);
    });
}

class InspectStore : public ::testing::Test {
protected:
    testing_support::ScratchDir scratch;
    const fs::path base = scratch / "base";

    ProcessResult run(const std::vector<std::string>& args, const testing_support::Environment& env = {}) {
        return inspect(scratch.path(), e2e::concat({"--base", base.string()}, args), env);
    }
};

// A file's modification time as the report writes it.
std::string checkTimeText(const fs::path& path) {
    const int64_t ns = store_test::mtimeNs(path);
    char text[64];
    const time_t seconds = ns / store_test::kSecond;
    struct tm utc {};
    gmtime_r(&seconds, &utc);
    const size_t length = std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%S", &utc);
    std::snprintf(text + length, sizeof text - length, ".%09lldZ", static_cast<long long>(ns % store_test::kSecond));
    return text;
}

std::string crcText(const store_test::Bytes& bytes) {
    char text[11];
    std::snprintf(text, sizeof text, "0x%08x", store_test::referenceCrc32(bytes));
    return text;
}

struct StateRow {
    const char* name;
    // Writes through the store (base, target, slot) and damages the slot directory by hand.
    std::function<void(const fs::path&, const Target&, size_t, const fs::path&)> make;
    const char* state;
    int current;             // 1 or 2; 0 for null
    const char* reasons[2];  // "" for a valid copy
    bool interrupted[2];
    int exitStatus;
    const char* problem;  // a text that one problem line of the plain report holds, after the path
};

const StateRow kStateRows[] = {
    {"never_written",
     [](const fs::path& b, const Target& target, size_t index, const fs::path&) {
         withSlot(b, target, index, [](Storage::TargetSlot&) {});
     },
     "empty",
     0,
     {"no check file", "no check file"},
     {false, false},
     0,
     ""},
    {"one_write",
     [](const fs::path& b, const Target& target, size_t index, const fs::path&) {
         withSlot(b, target, index, [](Storage::TargetSlot& s) { ASSERT_EQ(s.write(kFirst.data(), 300), 0u); });
     },
     "present",
     2,
     {"no check file", ""},
     {false, false},
     0,
     ""},
    {"erased",
     [](const fs::path& b, const Target& target, size_t index, const fs::path&) {
         twoWrites(b, target, index);
         withSlot(b, target, index, [](Storage::TargetSlot& s) { ASSERT_EQ(s.erase(), STATUS_OK); });
     },
     "absent-blob",
     2,
     {"", ""},
     {false, false},
     0,
     ""},
    {"crc_differs",
     [](const fs::path& b, const Target& target, size_t index, const fs::path& d) {
         twoWrites(b, target, index);
         store_test::flipByte(d / "1/data", 99);
     },
     "present",
     2,
     {"CRC differs", ""},
     {true, false},
     0,
     "/1: interrupted update (CRC differs), normal after a power cut"},
    // An erased slot is served too: its other copy's damage is an
    // interrupted update as well.
    {"crc_differs_beside_an_erased_copy",
     [](const fs::path& b, const Target& target, size_t index, const fs::path& d) {
         twoWrites(b, target, index);
         withSlot(b, target, index, [](Storage::TargetSlot& s) { ASSERT_EQ(s.erase(), STATUS_OK); });
         store_test::flipByte(d / "1/data", 99);
     },
     "absent-blob",
     2,
     {"CRC differs", ""},
     {true, false},
     0,
     "/1: interrupted update (CRC differs), normal after a power cut"},
    {"size_differs",
     [](const fs::path& b, const Target& target, size_t index, const fs::path& d) {
         twoWrites(b, target, index);
         fs::resize_file(d / "1/data", 10);
     },
     "present",
     2,
     {"size differs", ""},
     {true, false},
     0,
     "/1: interrupted update (size differs)"},
    {"check_file_of_9_bytes",
     [](const fs::path& b, const Target& target, size_t index, const fs::path& d) {
         twoWrites(b, target, index);
         fs::resize_file(d / "1/data.chk", 9);
     },
     "present",
     2,
     {"check file of 9 bytes", ""},
     {true, false},
     0,
     "/1: interrupted update (check file of 9 bytes)"},
    {"no_check_file",
     [](const fs::path& b, const Target& target, size_t index, const fs::path& d) {
         twoWrites(b, target, index);
         fs::remove(d / "1/data.chk");
     },
     "present",
     2,
     {"no check file", ""},
     {true, false},
     0,
     "/1: interrupted update (no check file)"},
    {"no_data_file",
     [](const fs::path& b, const Target& target, size_t index, const fs::path& d) {
         twoWrites(b, target, index);
         fs::remove(d / "2/data");
     },
     "present",
     1,
     {"", "no data file"},
     {false, true},
     0,
     "/2: interrupted update (no data file)"},
    {"leftover_tmp",
     [](const fs::path& b, const Target& target, size_t index, const fs::path& d) {
         twoWrites(b, target, index);
         writeBytes(d / "2/data.chk.tmp", {1, 2, 3});
     },
     "present",
     1,
     {"", ""},
     {false, false},
     0,
     "/2/data.chk.tmp: leftover of an interrupted commit"},
    {"data_is_a_directory",
     [](const fs::path& b, const Target& target, size_t index, const fs::path& d) {
         twoWrites(b, target, index);
         fs::remove(d / "1/data");
         fs::create_directories(d / "1/data/inside");
     },
     "present",
     2,
     {"data is a directory", ""},
     {false, false},
     1,
     "/1/data: is a directory, not a file"},
    {"check_file_is_a_link",
     [](const fs::path& b, const Target& target, size_t index, const fs::path& d) {
         twoWrites(b, target, index);
         fs::rename(d / "1/data.chk", d / "1/kept");
         fs::create_symlink("kept", d / "1/data.chk");
     },
     "present",
     2,
     {"check file is a link", ""},
     {false, false},
     1,
     "/1/data.chk: is a link, not a file"},
    {"lost",
     [](const fs::path& b, const Target& target, size_t index, const fs::path& d) {
         twoWrites(b, target, index);
         store_test::flipByte(d / "1/data", 0);
         fs::resize_file(d / "2/data.chk", 7);
     },
     "lost",
     0,
     {"CRC differs", "check file of 7 bytes"},
     {false, false},
     1,
     ": lost: copy 1: CRC differs; copy 2: check file of 7 bytes"},
};

class InspectStoreStates : public InspectStore, public ::testing::WithParamInterface<std::tuple<StateRow, Target>> {};

TEST_P(InspectStoreStates, PlainAndJsonReportTheSlot) {
    const StateRow& row = std::get<0>(GetParam());
    const Target& target = std::get<1>(GetParam());
    const size_t index = target.slots - 1;
    const fs::path slotDir = slotDirectory(base, target, index);
    row.make(base, target, index, slotDir);

    const ProcessResult json = run({"--target", target.name, "--json"});
    EXPECT_EQ(json.exitStatus, row.exitStatus) << json.out << json.err;
    const JsonValue document = parsed(json);
    if (document.isNull()) return;
    EXPECT_EQ(document["base"].text, base.string());
    ASSERT_EQ(document["targets"].items.size(), 1u);
    const JsonValue& reported = document["targets"][0];
    EXPECT_EQ(reported["name"].text, target.name);
    EXPECT_EQ(reported["path"].text, (base / target.location).string());
    EXPECT_TRUE(reported["error"].isNull());
    ASSERT_EQ(reported["slots"].items.size(), target.slots);
    const JsonValue& slot = reported["slots"][index];
    EXPECT_EQ(slot["index"].number, index);
    EXPECT_EQ(slot["state"].text, row.state);
    if (row.current == 0) {
        EXPECT_TRUE(slot["current"].isNull());
    } else {
        EXPECT_EQ(slot["current"].number, row.current);
    }
    ASSERT_EQ(slot["copies"].items.size(), 2u);
    for (size_t copy = 0; copy < 2; ++copy) {
        SCOPED_TRACE("copy " + std::to_string(copy + 1));
        const JsonValue& reportedCopy = slot["copies"][copy];
        const std::string reason = row.reasons[copy];
        EXPECT_EQ(reportedCopy["copy"].number, copy + 1);
        EXPECT_EQ(reportedCopy["valid"].boolean, reason.empty());
        EXPECT_EQ(reportedCopy["reason"].isNull() ? "" : reportedCopy["reason"].text, reason);
        EXPECT_EQ(reportedCopy["interrupted_update"].boolean, row.interrupted[copy]);
        const fs::path data = slotDir / (copy == 0 ? "1/data" : "2/data");
        if (fs::is_regular_file(fs::symlink_status(data))) {
            const store_test::Bytes bytes = readBytes(data);
            EXPECT_EQ(reportedCopy["size"].number, bytes.size());
            EXPECT_EQ(reportedCopy["crc32"].text, crcText(bytes));
        } else {
            EXPECT_TRUE(reportedCopy["size"].isNull());
            EXPECT_TRUE(reportedCopy["crc32"].isNull());
        }
        const fs::path check = slotDir / (copy == 0 ? "1/data.chk" : "2/data.chk");
        if (fs::is_regular_file(fs::symlink_status(check))) {
            EXPECT_EQ(reportedCopy["check_time"].text, checkTimeText(check));
        } else {
            EXPECT_TRUE(reportedCopy["check_time"].isNull());
        }
    }
    const bool leftover = fs::exists(fs::symlink_status(slotDir / "2/data.chk.tmp"));
    ASSERT_EQ(slot["leftover_tmp"].items.size(), leftover ? 1u : 0u);
    if (leftover) {
        EXPECT_EQ(slot["leftover_tmp"][0].text, (slotDir / "2/data.chk.tmp").string());
    }
    // Every other slot of a many-slot target is empty.
    for (size_t other = 0; other + 1 < target.slots; ++other) {
        EXPECT_EQ(reported["slots"][other]["state"].text, "empty");
    }

    const ProcessResult plain = run({"--target", target.name});
    EXPECT_EQ(plain.exitStatus, row.exitStatus) << plain.out << plain.err;
    bool found = false;
    std::string problems;
    for (const std::string& line : linesOf(plain.out)) {
        if (line.rfind("/", 0) == 0) problems += line + "\n";
        found = found ||
                (line.rfind(target.name, 0) == 0 && line.find(" " + std::to_string(index) + " ") != std::string::npos &&
                 line.find(std::string(" ") + row.state + " ") != std::string::npos);
    }
    EXPECT_TRUE(found) << plain.out;
    if (*row.problem != '\0') {
        EXPECT_NE(problems.find(slotDir.string() + row.problem), std::string::npos) << plain.out;
    } else {
        EXPECT_EQ(problems, "") << plain.out;
    }
}

INSTANTIATE_TEST_SUITE_P(Rows, InspectStoreStates,
                         ::testing::Combine(::testing::ValuesIn(kStateRows), ::testing::Values(kSettings, kLut)),
                         [](const ::testing::TestParamInfo<std::tuple<StateRow, Target>>& info) {
                             return std::string(std::get<0>(info.param).name) + "_" + std::get<1>(info.param).name;
                         });

TEST_F(InspectStore, EveryTargetOfTheRegistryIsReported) {
    twoWrites(base, kLut, 7);
    const ProcessResult result = run({"--json"});
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    const JsonValue document = parsed(result);
    if (document.isNull()) return;
    const std::vector<std::pair<std::string, size_t>> expected = {{"settings", 1},
                                                                  {"overlay", 8},
                                                                  {"lut", 26},
                                                                  {"calib_save", 1},
                                                                  {"calib_extra", 1},
                                                                  {"util_save", 1},
                                                                  {"application_internal", 1},
                                                                  {"reboot_persistent", 1}};
    ASSERT_EQ(document["targets"].items.size(), expected.size());
    for (size_t i = 0; i < expected.size(); ++i) {
        EXPECT_EQ(document["targets"][i]["name"].text, expected[i].first);
        EXPECT_EQ(document["targets"][i]["slots"].items.size(), expected[i].second);
    }
    EXPECT_EQ(document["targets"][2]["slots"][7]["state"].text, "present");
    // The stores of a base that was never used are not made by looking.
    EXPECT_FALSE(fs::exists(base / "settings"));
    const ProcessResult plain = run({});
    EXPECT_EQ(plain.exitStatus, 0);
    EXPECT_EQ(linesOf(plain.out).size(), 1u + 8 + 26 + 5) << plain.out;
}

TEST_F(InspectStore, OneSlotByIndexInEveryForm) {
    twoWrites(base, kLut, 25);
    for (const char* form : {"25", "0x19", "031"}) {
        const ProcessResult result = run({"--target", "lut", "-i", form, "--json"});
        EXPECT_EQ(result.exitStatus, 0) << form << result.err;
        const JsonValue document = parsed(result);
        if (document.isNull()) continue;
        ASSERT_EQ(document["targets"][0]["slots"].items.size(), 1u);
        EXPECT_EQ(document["targets"][0]["slots"][0]["index"].number, 25);
        EXPECT_EQ(document["targets"][0]["slots"][0]["state"].text, "present");
    }
}

TEST_F(InspectStore, DumpWritesExactlyTheBytesTheSlotReads) {
    twoWrites(base, kLut, 4);
    store_test::flipByte(slotDirectory(base, kLut, 4) / "1/data", 3);  // copy 2 serves again
    const fs::path copy = scratch / "copy";
    store_test::copyTree(base, copy);
    Storage::DualFileTarget store(copy / kLut.location, kLut.slots);
    Storage::SlotHandle handle = store.getSlot(4);
    const store_test::SlotContent served = store_test::contentOf(*handle.get());
    ASSERT_EQ(served, store_test::holding(kFirst));

    const ProcessResult toStdout = run({"--target", "lut", "--index", "4", "--dump", "-"});
    EXPECT_EQ(toStdout.exitStatus, 0) << toStdout.err;
    EXPECT_EQ(testing_support::bytesOf(toStdout.out), served.data);
    EXPECT_EQ(toStdout.err, "");

    const fs::path file = scratch / "out" / "dump.bin";
    fs::create_directories(file.parent_path());
    writeBytes(file, store_test::patternBytes(5000, 9));  // replaced whole
    const ProcessResult toFile = run({"--target=lut", "-i", "4", "--dump=" + file.string()});
    EXPECT_EQ(toFile.exitStatus, 0) << toFile.err;
    EXPECT_EQ(toFile.out, "");
    EXPECT_EQ(readBytes(file), served.data);
}

// A change in progress holds the slot's lock and the lock of the copy it
// rewrites: that copy is shown as such, not as damage, and nothing waits.
TEST_F(InspectStore, ChangeInProgressIsShownAsSuch) {
    twoWrites(base, kSettings, 0);  // copy 1 current; a change rewrites copy 2
    Storage::DualFileTarget store(base / kSettings.location, kSettings.slots);
    Storage::TargetSlot& slot = *store.getSlot(0).get();
    ASSERT_EQ(slot.beginWrite(), STATUS_OK);
    ASSERT_EQ(slot.writeAt(0, kFirst.data(), 100), STATUS_OK);

    const auto start = std::chrono::steady_clock::now();
    const ProcessResult plain = run({"--target", "settings"});
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
    EXPECT_EQ(plain.exitStatus, 0) << plain.out;
    const std::string slotDir = (base / kSettings.location).string();
    EXPECT_NE(plain.out.find("\n" + slotDir + ": change in progress\n"), std::string::npos) << plain.out;
    EXPECT_NE(plain.out.find("\n" + slotDir + "/2: being rewritten by a change in progress\n"), std::string::npos)
        << plain.out;
    EXPECT_EQ(plain.out.find("interrupted"), std::string::npos) << plain.out;

    const ProcessResult json = run({"--target", "settings", "--json"});
    EXPECT_EQ(json.exitStatus, 0) << json.out;
    const JsonValue document = parsed(json);
    if (document.isNull()) return;
    const JsonValue& reported = document["targets"][0]["slots"][0];
    EXPECT_EQ(reported["state"].text, "present");
    EXPECT_TRUE(reported["change_in_progress"].boolean);
    EXPECT_FALSE(reported["copies"][0]["being_rewritten"].boolean);
    EXPECT_TRUE(reported["copies"][1]["being_rewritten"].boolean);
    EXPECT_FALSE(reported["copies"][1]["interrupted_update"].boolean);

    ASSERT_EQ(slot.finalise(), STATUS_OK);
    const ProcessResult after = run({"--target", "settings", "--json"});
    const JsonValue done = parsed(after);
    if (done.isNull()) return;
    EXPECT_FALSE(done["targets"][0]["slots"][0]["change_in_progress"].boolean);
    EXPECT_FALSE(done["targets"][0]["slots"][0]["copies"][1]["being_rewritten"].boolean);
    EXPECT_EQ(done["targets"][0]["slots"][0]["current"].number, 2);
}

TEST_F(InspectStore, DumpOfASlotThatIsNotPresentIs10) {
    twoWrites(base, kSettings, 0);
    withSlot(base, kSettings, 0, [](Storage::TargetSlot& slot) { ASSERT_EQ(slot.erase(), STATUS_OK); });
    for (const char* target : {"settings", "calib_save"}) {
        const ProcessResult result = run({"--target", target, "--dump", "-"});
        EXPECT_EQ(result.exitStatus, 10) << target;
        EXPECT_EQ(result.out, "");
        EXPECT_NE(result.err.find(base.string()), std::string::npos) << result.err;
    }
}

// A dump that cannot be made names the path at fault on standard error,
// writes nothing to standard output and is damage.
TEST_F(InspectStore, ADumpThatFailsNamesWhatFailed) {
    twoWrites(base, kSettings, 0);
    fs::create_directories(base / "app");
    writeBytes(base / "app/luts", {1});
    const fs::path missing = scratch / "out" / "missing" / "dump.bin";
    const struct {
        std::vector<std::string> args;
        std::string message;
    } rows[] = {
        {{"--target", "lut", "--index", "0", "--dump", "-"},
         '"' + (base / "app/luts").string() + "\": Not a directory"},
        {{"--target", "settings", "--dump", missing.string()},
         '"' + missing.string() + "\": No such file or directory"},
        // A device that takes no data: the copy's bytes cannot be written.
        {{"--target", "settings", "--dump", "/dev/full"}, "\"/dev/full\": No space left on device"},
    };
    for (const auto& row : rows) {
        const ProcessResult result = run(row.args);
        EXPECT_EQ(result.exitStatus, 1) << e2e::describe(row.args);
        EXPECT_EQ(result.out, "") << e2e::describe(row.args);
        EXPECT_EQ(result.err, row.message + "\n") << e2e::describe(row.args);
    }
    EXPECT_FALSE(fs::exists(missing.parent_path()));
}

TEST_F(InspectStore, ATargetThatCannotBeOpenedIsNamed) {
    fs::create_directories(base / "app");
    writeBytes(base / "app/luts", {1});
    const ProcessResult result = run({"--target", "lut"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_NE(result.out.find((base / "app/luts").string() + ": Not a directory"), std::string::npos) << result.out;
}

// An I/O error on opening one of copy 1's files, as a failing card gives
// it: the copy names the error, the slot falls back to copy 2, the file's
// path is reported as damage and nothing changes.
struct UnreadableRow {
    const char* name;
    const char* file;     // in copy 1 of the settings store
    const char* reason;   // copy 1's
    const char* summary;  // what copy 1's column says after the reason
};

const UnreadableRow kUnreadableRows[] = {
    {"data", "data", "data unreadable: Input/output error", ", 200 bytes, checked "},
    {"check_file", "data.chk", "check file unreadable: Input/output error", ", 200 bytes crc "},
};

class InspectStoreUnreadable : public InspectStore, public ::testing::WithParamInterface<UnreadableRow> {};

TEST_P(InspectStoreUnreadable, AnIoErrorIsDamageNamedByItsText) {
    if (!testing_support::programEmulator().empty()) {
        GTEST_SKIP() << "native builds only: the shim cannot be preloaded under qemu-aarch64";
    }
    const UnreadableRow& row = GetParam();
    twoWrites(base, kSettings, 0);
    const fs::path dir = base / "settings";
    const fs::path file = dir / "1" / row.file;
    // "1/data" also matches "1/data.chk", whose opens come first; how many
    // there are depends on whether the kernel opens beneath a directory.
    const fs::path counted = scratch / "out" / "opens";
    fs::create_directories(counted.parent_path());
    const ProcessResult counting =
        run({"--target", "settings"}, testing_support::faultCountEnv("open", counted, (dir / "1/data.chk").string()));
    ASSERT_EQ(counting.exitStatus, 0) << counting.out << counting.err;
    const unsigned long checkOpens = testing_support::readFaultCount(counted);
    ASSERT_GE(checkOpens, 1u);
    const unsigned long first = std::string(row.file) == "data" ? checkOpens + 1 : 1;
    // Every later open of the file fails too, as it would on a broken card.
    const testing_support::Environment failing =
        testing_support::faultFromEnv("open", first, "errno:EIO", file.string());

    const ProcessResult json = run({"--target", "settings", "--json"}, failing);
    EXPECT_EQ(json.exitStatus, 1) << json.out << json.err;
    EXPECT_EQ(json.err, "");
    const JsonValue document = parsed(json);
    if (document.isNull()) return;
    const JsonValue& slot = document["targets"][0]["slots"][0];
    EXPECT_EQ(slot["state"].text, "present");
    EXPECT_EQ(slot["current"].number, 2);
    const JsonValue& copy1 = slot["copies"][0];
    EXPECT_FALSE(copy1["valid"].boolean);
    EXPECT_EQ(copy1["reason"].text, row.reason);
    EXPECT_FALSE(copy1["interrupted_update"].boolean);
    EXPECT_EQ(copy1["size"].number, kLater.size());
    EXPECT_TRUE(slot["copies"][1]["valid"].boolean);

    const ProcessResult plain = run({"--target", "settings"}, failing);
    EXPECT_EQ(plain.exitStatus, 1) << plain.out << plain.err;
    EXPECT_EQ(plain.err, "");
    const std::string copy1Text =
        std::string("copy 1: ") + row.reason + row.summary +
        (std::string(row.file) == "data" ? checkTimeText(dir / "1/data.chk")
                                         : crcText(kLater) + ", checked " + checkTimeText(dir / "1/data.chk"));
    const std::string copy2Text =
        "copy 2: valid, 300 bytes crc " + crcText(kFirst) + ", checked " + checkTimeText(dir / "2/data.chk");
    EXPECT_EQ(plain.out, "settings  0  present  current 2  " + copy1Text + "  " + copy2Text + "\n" + file.string() +
                             ": Input/output error\n");
}

INSTANTIATE_TEST_SUITE_P(Files, InspectStoreUnreadable, ::testing::ValuesIn(kUnreadableRows),
                         [](const ::testing::TestParamInfo<UnreadableRow>& info) { return info.param.name; });

struct CommandLineRow {
    std::vector<std::string> args;
    const char* message;  // in standard error, before the usage
};

const CommandLineRow kBadCommandLines[] = {
    {{"--no-such-option"}, "unrecognized option"},
    {{"--target", "nonsense"}, "Invalid target 'nonsense'"},
    {{"--target", "lut", "--index", "26"}, "Slot index 26 out of range: lut has slots 0 to 25"},
    {{"--target", "settings", "--index", "1"}, "Slot index 1 out of range"},
    {{"--target", "lut", "--index", "0x"}, "Invalid slot index '0x'"},
    {{"--target", "lut", "--index", "-1"}, "Invalid slot index '-1'"},
    {{"--index", "1"}, "--index needs --target"},
    {{"--dump", "-"}, "--dump needs --target"},
    {{"--target", "lut", "--dump", "-", "--json"}, "--dump and --json exclude each other"},
    {{"--boot-vector", "--target", "lut"}, "--boot-vector takes no other option but --json"},
    {{"--json", "extra"}, "Unexpected argument 'extra'"},
};

TEST_F(InspectStore, ABadCommandLineIs2WithUsageOnStandardError) {
    for (const CommandLineRow& row : kBadCommandLines) {
        const ProcessResult result = run(row.args);
        EXPECT_EQ(result.exitStatus, 2) << e2e::describe(row.args);
        EXPECT_EQ(result.out, "");
        EXPECT_NE(result.err.find(row.message), std::string::npos) << result.err;
        EXPECT_NE(result.err.find("Usage: " + e2e::kInspectStore + " "), std::string::npos) << result.err;
    }
    const ProcessResult help = run({"--help"});
    EXPECT_EQ(help.exitStatus, 0);
    EXPECT_EQ(help.out.rfind("Usage: " + e2e::kInspectStore + " ", 0), 0u) << help.out;
    EXPECT_EQ(help.err, "");
}

// Every planted kind at every place a slot keeps a file or directory: the
// report names it, nothing is followed or waited on, nothing changes.
TEST_F(InspectStore, PlantedEntriesAreNamedAndLeftAlone) {
    const testing_support::Victims victims(scratch / "victims");
    const std::string victimsBefore = testing_support::snapshotTree(scratch / "victims");
    const std::pair<const char*, const char*> places[] = {{"1/data", "data is a "},
                                                          {"1/data.chk", "check file is a "},
                                                          {"1/data.chk.tmp", ""},
                                                          {"1", "directory 3/1 is a "}};
    for (const auto& [place, reason] : places) {
        for (const testing_support::Plant plant : testing_support::allPlants()) {
            SCOPED_TRACE(std::string(place) + " " + testing_support::plantName(plant));
            fs::remove_all(base);
            twoWrites(base, kLut, 3);
            std::string why;
            if (!testing_support::plantAt(slotDirectory(base, kLut, 3) / place, plant, victims, why)) continue;
            const ProcessResult result = run({"--target", "lut", "--index", "3", "--json"});
            // A directory where a copy directory belongs is only a copy
            // without files; a hard link where a file belongs is a file
            // with someone else's bytes.
            const bool copyWithoutFiles = std::string(place) == "1" && plant == testing_support::Plant::kDirectory;
            const bool filesBytes = std::string(place) != "1" && testing_support::isHardLink(plant);
            EXPECT_EQ(result.exitStatus, copyWithoutFiles || filesBytes ? 0 : 1) << result.out << result.err;
            const JsonValue document = parsed(result);
            if (document.isNull()) continue;
            const JsonValue& slot = document["targets"][0]["slots"][0];
            if (copyWithoutFiles) {
                EXPECT_EQ(slot["copies"][0]["reason"].text, "no check file");
            } else if (filesBytes && *reason != '\0') {
                EXPECT_FALSE(slot["copies"][0]["valid"].boolean) << result.out;
            } else if (*reason == '\0') {
                EXPECT_TRUE(slot["copies"][0]["valid"].boolean);
                ASSERT_EQ(slot["leftover_tmp"].items.size(), 1u);
            } else {
                EXPECT_EQ(slot["copies"][0]["reason"].text.rfind(reason, 0), 0u) << result.out;
            }
            EXPECT_EQ(slot["state"].text, "present");
            EXPECT_EQ(slot["current"].number, *reason == '\0' ? 1 : 2);
            EXPECT_EQ(testing_support::snapshotTree(scratch / "victims"), victimsBefore);
        }
    }
}

// Opening a store in this process costs the emulated device sixty times
// what it costs the host; the library's own agreement test runs there in
// full beside the device's serial lane.
#ifdef MIGRATE_SETTINGS_ON_DEVICE
constexpr int kDamagedTreeRounds = 8;
#else
constexpr int kDamagedTreeRounds = 40;
#endif

// Random damage (truncated, flipped, deleted and retimed files) of slots
// written twice: the current copy and validity that inspect_store reports
// are what a DualFileTarget opened on a copy of the tree serves.
TEST_F(InspectStore, AgreesWithTheStoreOnRandomlyDamagedTrees) {
    std::mt19937 random(1125);
    for (int round = 0; round < kDamagedTreeRounds; ++round) {
        SCOPED_TRACE("round " + std::to_string(round));
        fs::remove_all(base);
        fs::remove_all(scratch / "copy");
        const Target& target = round % 2 == 0 ? kSettings : kLut;
        const size_t index = random() % target.slots;
        twoWrites(base, target, index);
        const fs::path dir = slotDirectory(base, target, index);
        store_test::damageAtRandom(dir, random);
        const ProcessResult result = run({"--target", target.name, "--index", std::to_string(index), "--json"});
        const JsonValue document = parsed(result);
        if (document.isNull()) continue;
        const JsonValue& slot = document["targets"][0]["slots"][0];

        store_test::copyTree(base, scratch / "copy");
        Storage::DualFileTarget store(scratch / "copy" / target.location, target.slots);
        Storage::SlotHandle handle = store.getSlot(index);
        const store_test::SlotContent served = store_test::contentOf(*handle.get());
        EXPECT_EQ(!slot["current"].isNull(), served.valid) << result.out;
        EXPECT_EQ(slot["state"].text == "present", served.valid && served.exists) << result.out;
        EXPECT_EQ(result.exitStatus, slot["state"].text == "lost" ? 1 : 0) << result.out;
        if (served.valid && served.exists) {
            EXPECT_EQ(served.data, slot["current"].number == 1 ? kLater : kFirst) << result.out;
        }
    }
}

TEST_F(InspectStore, BootVectorWithoutTheDevice) {
    if (e2e::currentHost() == e2e::Host::kSimulatedDevice) GTEST_SKIP() << "needs a host without /dev/mmcblk0";
    const ProcessResult result = inspect(scratch.path(), {"--boot-vector"});
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_EQ(result.out, "");
    EXPECT_NE(result.err.find("/dev/mmcblk0: the boot-vector record could not be located"), std::string::npos)
        << result.err;
}

// The record that tests/device/run_on_device.sh wrote, with what its
// checksums should be, computed here.
struct WrittenRecord {
    uint64_t sector = 0;
    uint32_t value = 0;
    unsigned headerStored = 0, headerComputed = 0;
    unsigned recordStored = 0, recordComputed = 0;

    bool headerHolds() const { return headerStored == headerComputed; }
    bool recordHolds() const { return recordStored == recordComputed; }
};

std::optional<WrittenRecord> writtenRecord() {
    const char* sector = std::getenv("SIMULATED_DEVICE_BOOT_VECTOR_SECTOR");
    const char* hex = std::getenv("SIMULATED_DEVICE_BOOT_VECTOR_RECORD");
    if (sector == nullptr || hex == nullptr || std::strlen(hex) != 40) return std::nullopt;
    store_test::Bytes bytes;
    for (size_t i = 0; i < 40; i += 2)
        bytes.push_back(static_cast<uint8_t>(std::stoul(std::string(hex + i, 2), 0, 16)));
    WrittenRecord record;
    record.sector = std::stoull(sector);
    record.value = static_cast<uint32_t>(bytes[0]) << 24 | bytes[1] << 16 | bytes[2] << 8 | bytes[3];
    record.headerStored = bytes[8];
    for (size_t i = 0; i < 8; ++i) record.headerComputed = (record.headerComputed + bytes[i]) & 0xff;
    record.recordStored = bytes[18] | bytes[19] << 8;
    record.recordComputed = e2e::bsdChecksum16(bytes.data(), 18);
    return record;
}

bool onBadRecordDevice() {
    const char* variant = std::getenv("SIMULATED_DEVICE_VARIANT");
    return variant != nullptr && std::string(variant) == "badrecord";
}

std::string hexText(unsigned value, int digits) {
    char text[16];
    std::snprintf(text, sizeof text, "0x%0*x", digits, value);
    return text;
}

// inspect_store --boot-vector, plain and JSON, against the record as
// written: exact text, and exit status 1 exactly when a checksum fails.
void expectBootVectorReport(const fs::path& root, const WrittenRecord& record) {
    const bool valid = record.headerHolds() && record.recordHolds();
    const auto holds = [](bool yes) { return yes ? " holds\n" : " does not hold\n"; };
    const ProcessResult plain = inspect(root, {"--boot-vector"});
    EXPECT_EQ(plain.exitStatus, valid ? 0 : 1) << plain.err;
    EXPECT_EQ(plain.err, "");
    EXPECT_EQ(plain.out, "sector " + std::to_string(record.sector) + " (byte " + std::to_string(record.sector * 512) +
                             " of /dev/mmcblk0)\nvalue " + std::to_string(record.value) + "\nheader_checksum stored " +
                             hexText(record.headerStored, 2) + " computed " + hexText(record.headerComputed, 2) +
                             holds(record.headerHolds()) + "record_checksum stored " + hexText(record.recordStored, 4) +
                             " computed " + hexText(record.recordComputed, 4) + holds(record.recordHolds()) +
                             (valid ? "record valid\n" : "record invalid\n"));

    const ProcessResult json = inspect(root, {"--boot-vector", "--json"});
    EXPECT_EQ(json.exitStatus, valid ? 0 : 1) << json.err;
    EXPECT_EQ(json.err, "");
    const JsonValue document = parsed(json);
    if (document.isNull()) return;
    EXPECT_EQ(document["sector"].number, record.sector);
    EXPECT_EQ(document["offset"].number, record.sector * 512);
    EXPECT_EQ(document["value"].number, record.value);
    EXPECT_EQ(document["header_checksum"]["stored"].text, hexText(record.headerStored, 2));
    EXPECT_EQ(document["header_checksum"]["computed"].text, hexText(record.headerComputed, 2));
    EXPECT_EQ(document["header_checksum"]["holds"].boolean, record.headerHolds());
    EXPECT_EQ(document["record_checksum"]["stored"].text, hexText(record.recordStored, 4));
    EXPECT_EQ(document["record_checksum"]["computed"].text, hexText(record.recordComputed, 4));
    EXPECT_EQ(document["record_checksum"]["holds"].boolean, record.recordHolds());
    EXPECT_EQ(document["valid"].boolean, valid);
}

// Runs only inside the simulated device (its normal and badrecord
// variants), never in the host's own run.
class InspectStoreOnDevice : public InspectStore {};

TEST_F(InspectStoreOnDevice, BootVector) {
    if (e2e::currentHost() != e2e::Host::kSimulatedDevice) GTEST_SKIP() << "needs the simulated device";
    if (onBadRecordDevice()) GTEST_SKIP() << "the device's record is invalid on purpose";
    const std::optional<WrittenRecord> record = writtenRecord();
    ASSERT_TRUE(record) << "run_on_device.sh named no record";
    ASSERT_TRUE(record->headerHolds() && record->recordHolds());
    expectBootVectorReport(scratch.path(), *record);
}

// Runs on the badrecord devices of tests/e2e/CMakeLists.txt.
TEST_F(InspectStoreOnDevice, BootVectorWithChecksumsThatDoNotHold) {
    if (e2e::currentHost() != e2e::Host::kSimulatedDevice) GTEST_SKIP() << "needs the simulated device";
    if (!onBadRecordDevice()) GTEST_SKIP() << "needs the simulated device's badrecord variant";
    const std::optional<WrittenRecord> record = writtenRecord();
    ASSERT_TRUE(record) << "run_on_device.sh named no record";
    ASSERT_FALSE(record->headerHolds() && record->recordHolds());
    expectBootVectorReport(scratch.path(), *record);
}

}  // namespace
