// The real migrate_settings, as root, over stores into which a less trusted
// program has planted links (symbolic and hard), FIFOs, sockets, device
// nodes and directories: no run writes outside the base directory or
// waits, and each one either stores the blob or fails.
#include <sys/stat.h>
#include <unistd.h>
#include <csignal>
#include <filesystem>
#include <iterator>
#include <string>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#include "child_process.h"
#include "files.h"
#include "hostile_tree.h"
#include "scratch_dir.h"
#include "tool_run.h"

namespace {

namespace fs = std::filesystem;
using e2e::Bytes;
using e2e::concat;
using e2e::ProcessResult;
using testing_support::Plant;

// The unprivileged user an application runs as.
constexpr uid_t kNobody = 65534;

void expectFinished(const ProcessResult& result) {
    EXPECT_NE(result.signal, SIGALRM) << "still running after " << e2e::kRunTimeLimitSeconds << " s";
    EXPECT_EQ(result.signal, 0) << result.out << result.err;
}

// Whether one copy of the store at `store` holds `blob` with its check file.
bool committed(const fs::path& store, const Bytes& blob) {
    for (const char* copy : {"1", "2"}) {
        const fs::path data = store / copy / "data";
        const fs::path check = store / copy / "data.chk";
        if (fs::is_regular_file(data) && fs::is_regular_file(check) && testing_support::readBytes(data) == blob &&
            testing_support::readBytes(check) == e2e::checkFileFor(blob)) {
            return true;
        }
    }
    return false;
}

class HostileStores : public ::testing::Test {
protected:
    HostileStores() { fs::create_directory(inputs); }

    testing_support::ScratchDir scratch;
    const fs::path base = scratch / "base";
    const fs::path inputs = scratch / "inputs";
    const testing_support::Victims victims{scratch / "victims"};

    std::string dataFile(const std::string& name, const Bytes& bytes) {
        testing_support::writeBytes(inputs / name, bytes);
        return (inputs / name).string();
    }

    ProcessResult run(const std::vector<std::string>& args) const {
        return e2e::runTool(concat({"--base", base.string()}, args), e2e::kRunTimeLimitSeconds);
    }

    // Everything outside the base directory and the data files.
    std::string outside() const { return testing_support::snapshotTree(scratch.path(), {"base", "inputs"}); }

    // Two migrations of util_save, one into each copy: each exits 0 and its
    // blob is committed, whatever was planted in the copies.
    void migrateUtilSaveTwice(uint8_t seed) {
        for (int round = 0; round < 2; ++round) {
            const Bytes blob = e2e::pattern(64 + round, seed);
            const ProcessResult result =
                run({"--target", "util_save", "--type", "simple", "--data", dataFile("blob", blob)});
            expectFinished(result);
            EXPECT_EQ(result.exitStatus, 0) << result.out;
            EXPECT_TRUE(committed(base / "app/utilSave", blob)) << "round " << round;
        }
    }

    // migrateUtilSaveTwice, and nothing outside the store changes.
    void migrateUtilSaveTwiceLeavingOutsideAlone(uint8_t seed) {
        const std::string before = outside();
        migrateUtilSaveTwice(seed);
        EXPECT_EQ(outside(), before);
    }

    void plant(const std::string& relative, Plant what) {
        std::string reason;
        if (!testing_support::plantAt(base / relative, what, victims, reason)) GTEST_SKIP() << reason;
    }
};

// A link planted at the data file that the next migration writes used to
// make that migration write the blob into the link's target.
TEST_F(HostileStores, LinkAtTheOtherCopysDataIsNeverWrittenThrough) {
    plant("settings/2/data", Plant::kLinkToFile);
    const std::string before = outside();
    const std::string blob = dataFile("blob", e2e::pattern(100, 1));

    const ProcessResult result = run({"--target", "settings", "--type", "simple", "--data", blob});
    expectFinished(result);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_NE(result.out.find("Failed to open " + (base / "settings/2/data").string() +
                              ": Too many levels of symbolic links\n"),
              std::string::npos)
        << result.out;
    EXPECT_EQ(outside(), before);
    EXPECT_TRUE(fs::is_symlink(base / "settings/2/data"));
    EXPECT_EQ(run({"--target", "settings", "--query-present"}).exitStatus, 10);
}

// A hard link planted at a copy's data file, to a root-only file on the
// same file system, used to make the migration into that copy overwrite
// the file with the blob and exit 0. Both copies are written here, so the
// plant is met whichever copy is current.
TEST_F(HostileStores, HardLinkAtADataFileIsNeverWrittenThrough) {
    plant("app/utilSave/2/data", Plant::kHardLinkToRootOnlyFile);
    migrateUtilSaveTwiceLeavingOutsideAlone(30);
    EXPECT_EQ(run({"--target", "util_save", "--query-present"}).exitStatus, 0);
}

// A hard link planted at the transient check file used to make the next
// commit truncate the link's target and write the 8 check bytes into it.
TEST_F(HostileStores, HardLinkAtTheTransientCheckFileIsNeverWrittenThrough) {
    plant("app/utilSave/1/data.chk.tmp", Plant::kHardLinkToRootOnlyFile);
    migrateUtilSaveTwiceLeavingOutsideAlone(40);
    EXPECT_FALSE(fs::exists(fs::symlink_status(base / "app/utilSave/1/data.chk.tmp")));
}

// What /proc/sys/fs/protected_hardlinks holds: "1" where the kernel refuses
// a user a hard link to a file it does not own.
std::string protectedHardlinks() {
    const fs::path setting = "/proc/sys/fs/protected_hardlinks";
    return fs::exists(setting) ? testing_support::readText(setting).substr(0, 1) : "";
}

// The plant made as an application makes it: by an unprivileged user who
// owns the store, linking a root-only file it cannot even read.
TEST_F(HostileStores, AnApplicationsHardLinkToARootOnlyFileIsNeverWrittenThrough) {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root, to run the application as nobody and the tool as root";
    if (protectedHardlinks() != "0") {
        GTEST_SKIP() << "fs.protected_hardlinks is on here, so no unprivileged user can make this link; "
                        "the device's kernel, with no init system to turn it on, leaves it off";
    }
    const Bytes first = e2e::pattern(50, 50);
    ASSERT_EQ(run({"--target", "util_save", "--type", "simple", "--data", dataFile("first", first)}).exitStatus, 0);
    // The application owns its store; the victims lie where it can reach them.
    for (const fs::path& path : {base / "app/utilSave", base / "app/utilSave/1", base / "app/utilSave/2"}) {
        fs::create_directories(path);
        ASSERT_EQ(::chown(path.c_str(), kNobody, kNobody), 0) << path;
    }
    fs::permissions(scratch.path(), fs::perms::others_exec, fs::perm_options::add);
    const fs::path victim = victims.rootOnlyFile();
    const std::string before = outside();
    for (const char* place : {"app/utilSave/1/data", "app/utilSave/2/data", "app/utilSave/1/data.chk.tmp"}) {
        const fs::path where = base / place;
        const testing_support::ProcessResult planted = testing_support::runInChild([&] {
            if (::setgid(kNobody) != 0 || ::setuid(kNobody) != 0) return 2;
            (void)::unlink(where.c_str());
            return ::link(victim.c_str(), where.c_str()) == 0 ? 0 : 1;
        });
        ASSERT_EQ(planted.exitStatus, 0) << "nobody could not link " << victim << " at " << where;
    }
    migrateUtilSaveTwice(60);
    EXPECT_EQ(outside(), before);
}

// A FIFO planted in one store used to make every run wait forever while
// the registry opened the stores, whatever the target.
TEST_F(HostileStores, FifoInOneStoreNeverHoldsUpARun) {
    plant("app/internal/2/data", Plant::kFifo);
    const std::string before = outside();
    for (const char* target : {"settings", "lut", "overlay", "calib_save", "calib_extra", "util_save",
                               "application_internal", "reboot_persistent"}) {
        SCOPED_TRACE(target);
        const ProcessResult query = run({"--target", target, "--query-present"});
        expectFinished(query);
        EXPECT_EQ(query.exitStatus, 10);
    }
    const std::string blob = dataFile("blob", e2e::pattern(100, 2));
    const ProcessResult elsewhere = run({"--target", "settings", "--type", "simple", "--data", blob});
    expectFinished(elsewhere);
    EXPECT_EQ(elsewhere.exitStatus, 0) << elsewhere.out;
    EXPECT_EQ(run({"--target", "settings", "--query-present"}).exitStatus, 0);

    // The FIFO is where this migration would write: it fails at once.
    const ProcessResult into = run({"--target", "application_internal", "--type", "simple", "--data", blob});
    expectFinished(into);
    EXPECT_EQ(into.exitStatus, 1);
    EXPECT_NE(
        into.out.find("Failed to open " + (base / "app/internal/2/data").string() + ": No such device or address\n"),
        std::string::npos)
        << into.out;
    EXPECT_EQ(outside(), before);
}

// The data file is the script's to choose, yet a FIFO there is refused at
// once rather than waited on.
TEST_F(HostileStores, FifoAsTheDataFileIsRefusedAtOnce) {
    const fs::path fifo = inputs / "fifo";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0666), 0);
    const ProcessResult result = run({"--target", "settings", "--type", "simple", "--data", fifo.string()});
    expectFinished(result);
    EXPECT_EQ(result.exitStatus, 1);
    EXPECT_NE(result.out.find("lib/storage/tools/migrate_settings:494 Failed to open '" + fifo.string() + "'\n"),
              std::string::npos)
        << result.out;
}

// Places the tool's stores touch: a path below the base directory, and
// the target and slot whose migrations reach it.
struct Place {
    const char* name;
    const char* relative;
    const char* target;
    const char* index;
};

const Place kPlaces[] = {
    {"copy0_data", "settings/1/data", "settings", "0"},
    {"copy0_check", "settings/1/data.chk", "settings", "0"},
    {"copy0_tmp", "settings/1/data.chk.tmp", "settings", "0"},
    {"copy0_directory", "settings/1", "settings", "0"},
    {"copy1_data", "settings/2/data", "settings", "0"},
    {"copy1_check", "settings/2/data.chk", "settings", "0"},
    {"copy1_tmp", "settings/2/data.chk.tmp", "settings", "0"},
    {"copy1_directory", "settings/2", "settings", "0"},
    {"slot_directory", "app/luts/3", "lut", "3"},
};

class HostileStoreSweep : public HostileStores, public ::testing::WithParamInterface<std::tuple<size_t, Plant>> {
protected:
    const Place& place() const { return kPlaces[std::get<0>(GetParam())]; }
    std::vector<std::string> slotArgs() const { return {"--target", place().target, "--index", place().index}; }
};

// Two migrations (one into each copy) and a query, after two that filled
// both copies: each run ends in time with 0 or 1 (10 or 0 for the query),
// and the query agrees with the last migration that succeeded.
TEST_P(HostileStoreSweep, MigrationsStayInsideTheBaseAndNeverWait) {
    for (int filled = 0; filled < 2; ++filled) {
        const std::string blob = dataFile("filled-" + std::to_string(filled), e2e::pattern(40 + filled, 10));
        ASSERT_EQ(run(concat(slotArgs(), {"--type", "simple", "--data", blob})).exitStatus, 0);
    }
    plant(place().relative, std::get<1>(GetParam()));
    if (IsSkipped()) return;
    const std::string before = outside();

    bool stored = false;
    for (int round = 0; round < 2; ++round) {
        const std::string blob = dataFile("blob-" + std::to_string(round), e2e::pattern(100 + round, 20));
        const ProcessResult result = run(concat(slotArgs(), {"--type", "simple", "--data", blob}));
        expectFinished(result);
        EXPECT_TRUE(result.exitStatus == 0 || result.exitStatus == 1) << result.exitStatus;
        stored = result.exitStatus == 0;
    }
    const ProcessResult query = run(concat(slotArgs(), {"--query-present"}));
    expectFinished(query);
    EXPECT_TRUE(query.exitStatus == 0 || query.exitStatus == 10) << query.exitStatus;
    if (stored) {
        EXPECT_EQ(query.exitStatus, 0);
    }
    EXPECT_EQ(outside(), before);
}

std::string caseName(const ::testing::TestParamInfo<HostileStoreSweep::ParamType>& info) {
    return std::string(kPlaces[std::get<0>(info.param)].name) + "_" +
           testing_support::plantName(std::get<1>(info.param));
}

// Each case costs five runs of the tool, and a run costs the emulated
// device twenty to fifty times what it costs the host: there the tool meets
// every plant at a data, check and transient file and at both kinds of
// directory (the places of copy 1 take the first write after the plant),
// while the library's sweep, in one process, covers every place there too.
#ifdef MIGRATE_SETTINGS_ON_DEVICE
const size_t kSweptPlaces[] = {3, 4, 5, 6, 8};
#else
const size_t kSweptPlaces[] = {0, 1, 2, 3, 4, 5, 6, 7, 8};
#endif

INSTANTIATE_TEST_SUITE_P(Planted, HostileStoreSweep,
                         ::testing::Combine(::testing::ValuesIn(kSweptPlaces),
                                            ::testing::ValuesIn(testing_support::allPlants())),
                         caseName);

}  // namespace
