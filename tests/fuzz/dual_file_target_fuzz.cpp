// Opening a one-slot dual-file store from arbitrary on-disk states and
// reading it, against a reference model of copy validation and choice.
//
// Input: a flags byte, one modification-time byte per check file, then for
// copy 0 and copy 1 a data length byte with the data and a check length
// byte with the raw check bytes. Flags per copy c (shift 3*c): bit 0 data
// present, bit 1 check file present, bit 2 check file holds the correct
// value instead of the raw bytes.
#include <fcntl.h>
#include <sys/stat.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <vector>

#include "fuzz_support.h"
#include "lib/storage/dual_file_target.h"
#include "scratch_dir.h"

namespace fs = std::filesystem;

namespace {

constexpr time_t kBaseTime = 1600000000;

struct CopyState {
    bool dataPresent = false;
    bool checkPresent = false;
    std::vector<uint8_t> data;
    std::vector<uint8_t> check;
    time_t checkTime = 0;
};

uint64_t expectedCheckValue(const CopyState& copy) {
    if (!copy.dataPresent) return ~uint64_t{0};
    return static_cast<uint64_t>(copy.data.size()) |
           static_cast<uint64_t>(fuzz_support::referenceCrc32(copy.data.data(), copy.data.size())) << 32;
}

void writeFile(const fs::path& path, const std::vector<uint8_t>& bytes) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
    FUZZ_CHECK(out.good());
}

bool isValid(const CopyState& copy) {
    if (!copy.checkPresent || copy.check.size() != 8) return false;
    uint64_t stored = 0;
    for (size_t i = 0; i < 8; ++i) stored |= static_cast<uint64_t>(copy.check[i]) << (8 * i);
    return stored == expectedCheckValue(copy);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    fuzz_support::quietProductOutput();
    static testing_support::ScratchDir scratch;
    const fs::path slotDir = scratch / "slot";
    fs::remove_all(slotDir);

    fuzz_support::ByteReader input(data, size);
    const uint8_t flags = input.byte();
    std::array<CopyState, 2> copies;
    copies[0].checkTime = kBaseTime + input.byte();
    copies[1].checkTime = kBaseTime + input.byte();
    for (size_t c = 0; c < 2; ++c) {
        CopyState& copy = copies[c];
        const unsigned bits = flags >> (3 * c);
        copy.dataPresent = bits & 1u;
        copy.checkPresent = bits & 2u;
        size_t taken = 0;
        const uint8_t* bytes = input.take(input.byte(), taken);
        copy.data.assign(bytes, bytes + taken);
        bytes = input.take(input.byte() % 16, taken);
        copy.check.assign(bytes, bytes + taken);
        if (bits & 4u) {
            const uint64_t value = expectedCheckValue(copy);
            copy.check.resize(8);
            for (size_t i = 0; i < 8; ++i) copy.check[i] = static_cast<uint8_t>(value >> (8 * i));
        }
    }

    const fs::path dataPaths[2] = {slotDir / "1" / "data", slotDir / "2" / "data"};
    for (size_t c = 0; c < 2; ++c) {
        const CopyState& copy = copies[c];
        fs::create_directories(dataPaths[c].parent_path());
        if (copy.dataPresent) writeFile(dataPaths[c], copy.data);
        if (copy.checkPresent) {
            const fs::path checkPath = dataPaths[c].string() + ".chk";
            writeFile(checkPath, copy.check);
            const struct timespec times[2] = {{copy.checkTime, 0}, {copy.checkTime, 0}};
            FUZZ_CHECK(utimensat(AT_FDCWD, checkPath.c_str(), times, 0) == 0);
        }
    }

    const bool valid[2] = {isValid(copies[0]), isValid(copies[1])};
    const size_t current = valid[1] && (!valid[0] || copies[1].checkTime > copies[0].checkTime) ? 1 : 0;

    Storage::DualFileTarget target(slotDir, 1);
    FUZZ_CHECK(target.getSlotCount() == 1);
    Storage::SlotHandle slot = target.getSlot(0);
    FUZZ_CHECK(slot);

    // Opening deletes exactly the check files that do not match.
    for (size_t c = 0; c < 2; ++c) {
        FUZZ_CHECK(fs::exists(dataPaths[c].string() + ".chk") == valid[c]);
        FUZZ_CHECK(fs::exists(dataPaths[c]) == copies[c].dataPresent);
    }
    FUZZ_CHECK(slot->isValid() == valid[current]);
    FUZZ_CHECK(slot->exists() == (valid[current] && copies[current].dataPresent));

    std::vector<uint8_t> buffer(copies[current].data.size() + 16, 0xA5);
    size_t bytesRead = 99999;
    const Status status = slot->readSome(buffer.data(), buffer.size(), 0, bytesRead);
    FUZZ_CHECK(status == STATUS_OK || status == STATUS_NOT_FOUND || status == STATUS_FAILED);
    if (!copies[current].dataPresent) {
        FUZZ_CHECK(status == STATUS_NOT_FOUND);
    } else if (!valid[current]) {
        FUZZ_CHECK(status == STATUS_FAILED);
    } else {
        FUZZ_CHECK(status == STATUS_OK);
        FUZZ_CHECK(bytesRead == copies[current].data.size());
        buffer.resize(bytesRead);
        FUZZ_CHECK(buffer == copies[current].data);
    }
    return 0;
}
