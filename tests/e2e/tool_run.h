// Running the built migrate_settings and looking at what it left in a store,
// with the block formats and checksums computed here, independently of the
// product's own code.
#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "child_process.h"
#include "files.h"

namespace e2e {

using testing_support::Bytes;
using testing_support::ProcessResult;

extern const std::string kBinary;
// The built inspect_store.
extern const std::string kInspectStore;

// A time limit for runs: long enough for an emulated run, and an end to one
// that waits on a FIFO or a held lock longer than it should.
constexpr unsigned kRunTimeLimitSeconds = 30;

// Runs the tool with `args` after its own path; the result as it came. With
// a time limit, a run still going after that many seconds is ended by
// SIGALRM.
ProcessResult runTool(std::vector<std::string> args, unsigned timeLimitSeconds = 0);

// Where a run happens decides what building the registry logs: the
// boot-vector target reads its record from "/dev/mmcblk0" on every run.
enum class Host {
    kSimulatedDevice,  // inside tests/device/run_on_device.sh: a valid record
    kWithoutDevice,    // no "/dev/mmcblk0": the record cannot be located
};

// kSimulatedDevice when SIMULATED_DEVICE=1, else kWithoutDevice.
Host currentHost();

// What the partitioning tool (or the shell, when the tool is missing) says
// on standard error when there is no "/dev/mmcblk0", one line each.
extern const std::vector<std::string> kSfdiskComplaints;

// For a run that got past option parsing, so that the registry was built.
// Without the device: checks that standard output holds exactly one line
// "lib/storage/storage_target:<line> Failed to parse flash size ''" (when
// "Register " lines were printed, right after the last file-read target's
// one) and that standard error holds exactly one of kSfdiskComplaints;
// returns the result without those two lines. On the device: checks that there is no
// such line and returns the result unchanged (its standard error is then
// the tool's own). Mismatches are reported as non-fatal test failures.
ProcessResult withoutBootVectorFailure(ProcessResult result, Host host = currentHost());

// runTool for a command line that passes option parsing, through
// withoutBootVectorFailure.
ProcessResult runAccepted(std::vector<std::string> args);

// " 'a' 'b'" for traces.
std::string describe(const std::vector<std::string>& args);

std::vector<std::string> concat(std::vector<std::string> head, const std::vector<std::string>& tail);

// The fourteen "Register " lines that --verbose prints for `base`, in
// order: the eight dual-file stores, then the fixed device targets.
std::string registerLines(const std::filesystem::path& base);

// The last of the three file-read targets' lines, after which the
// boot-vector target is built.
extern const std::string kLastFileReadRegisterLine;

// Relative paths below a store's base directory.
using Files = std::vector<std::string>;

// Every entry below `base` that is not a directory, as sorted relative
// paths; empty when `base` does not exist.
Files storedFiles(const std::filesystem::path& base);

// IEEE 802.3 CRC-32, bit by bit.
uint32_t crc32(const Bytes& bytes);

// The 8 bytes a check file holds for a data file with these contents:
// size, then CRC-32, both little-endian.
Bytes checkFileFor(const Bytes& data);

// The 16-bit rotate-right-and-add checksum, seed 0.
uint16_t bsdChecksum16(const uint8_t* data, size_t count);

// Bytes that differ from offset to offset, so that a shifted or truncated
// copy never compares equal. `seed` tells two such blocks apart.
Bytes pattern(size_t size, uint8_t seed);

void putLe16(Bytes& bytes, size_t offset, uint16_t value);
void putLe32(Bytes& bytes, size_t offset, uint32_t value);

// A settings block declaring `declared` bytes (length field, contents,
// checksum), filled with 0xEE up to `fileSize`. Needs 4 <= declared <= fileSize.
Bytes settingsBlock(uint16_t declared, size_t fileSize, uint8_t seed = 1);

// A lookup table of `size` bytes with the header 80 11 02 00.
Bytes lutFile(size_t size, uint8_t seed = 2);

// An overlay: good 284-byte header declaring `payload` bytes, `fileSize`
// bytes in all.
Bytes overlayFile(uint32_t payload, size_t fileSize, uint8_t seed = 3);

}  // namespace e2e
