// What the dual-file store's files must look like, computed without the
// library, and small helpers to inspect and age them.
#pragma once

#include <cstdint>
#include <ctime>
#include <filesystem>
#include <iosfwd>
#include <random>
#include <string>
#include <vector>

#include "files.h"
#include "lib/storage/storage_target.h"

namespace store_test {

using testing_support::Bytes;

// One second in nanoseconds, the unit of file times here.
constexpr int64_t kSecond = 1000000000;
// A fixed, clearly past instant: 2020-01-01T00:00:00.5Z.
constexpr int64_t kPast = 1577836800 * kSecond + kSecond / 2;

Bytes bytesOf(const std::string& text);
// `count` bytes of a fixed pseudo-random pattern chosen by `seed`.
Bytes patternBytes(size_t count, uint32_t seed);
using testing_support::hex;

// CRC-32 of IEEE 802.3 one bit at a time, straight from the polynomial.
uint32_t referenceCrc32(const Bytes& data);
// The 8 bytes of a check file for `data`: size then CRC, little-endian.
Bytes expectedCheckFile(const Bytes& data);
// The check file of a committed absent blob: all ones.
Bytes absentCheckFile();

// Nanoseconds since the epoch of the file's st_mtim; throws when missing.
int64_t mtimeNs(const std::filesystem::path& path);
void setMtimeNs(const std::filesystem::path& path, int64_t ns);
int64_t nowNs();
// Creates (or truncates) a file so that the kernel stamps the current time.
int64_t touchNow(const std::filesystem::path& path);

// Flips one bit of the byte at `offset`, keeping the file's time: damage
// that only the check value can see.
void flipByte(const std::filesystem::path& path, size_t offset);

// Damages one to three of the store files of the slot directory
// `slotDirectory` ("1/data", "1/data.chk", "2/data", "2/data.chk") as the
// field does, each at random: truncated, a byte flipped, deleted, or its
// time set to kPast plus 0 to 2 s.
void damageAtRandom(const std::filesystem::path& slotDirectory, std::mt19937& random);

// Copies the tree `from` to `to` (which must not exist), links as links,
// with the modification times of its files, which decide the current copy.
void copyTree(const std::filesystem::path& from, const std::filesystem::path& to);

// The describeTree lines of a valid copy ("1" or "2") holding `blob`.
std::string copyLines(const std::string& copy, const Bytes& blob);

// One line per entry below `root`, sorted: "d <path>" for a directory,
// "f <path> <hex>" for a file, with " @<mtime ns>" when `withTimes`.
std::string describeTree(const std::filesystem::path& root, bool withTimes = false);

// Writes a valid copy by hand: data (or none when `absent`) and its check
// file, dated `checkTimeNs`.
void writeCopy(const std::filesystem::path& copyDir, const Bytes& data, int64_t checkTimeNs);
void writeAbsentCopy(const std::filesystem::path& copyDir, int64_t checkTimeNs);

struct SlotContent {
    bool exists = false;
    bool valid = false;
    Status status = STATUS_OK;  // of readSome at offset 0
    Bytes data;                 // what it read

    bool operator==(const SlotContent& other) const;
    bool operator!=(const SlotContent& other) const { return !(*this == other); }
};
std::ostream& operator<<(std::ostream& out, const SlotContent& content);

// What a slot shows: exists, isValid and everything read from offset 0.
SlotContent contentOf(Storage::TargetSlot& slot);
// A valid slot holding `data`.
SlotContent holding(const Bytes& data);
// A valid slot holding a committed absent blob.
SlotContent absentBlob();
// A slot without a valid copy or data.
SlotContent nothingStored();

}  // namespace store_test
