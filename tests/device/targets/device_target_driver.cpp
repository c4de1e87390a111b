// One device-target operation per run, for tests that fail its calls
// through the fault-injection shim. The log goes to standard output at the
// informational threshold, followed by the results:
//
//   device_target_driver boot-vector-write HEX40
//       "write <status>", then "read <status> <count> <hex>" of the slot
//   device_target_driver boot-update SLOT FILE
//       streams FILE in 4096-byte blocks into the boot-file slot:
//       "begin <status>", "writes <status>", "finalise <status> valid <0|1>"
//   device_target_driver partition-update FILE
//       the same into the resource partition's slot: "begin <status>",
//       "writes <status>", "finalise <status>"
#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <string>
#include <vector>

#include "files.h"
#include "lib/storage/boot_vector_target.h"
#include "lib/storage/firmware_update_boot_target.h"
#include "lib/storage/firmware_update_partition_target.h"
#include "lib/util/log.h"

namespace {

using Bytes = std::vector<uint8_t>;

int usage() {
    std::fprintf(stderr,
                 "usage: device_target_driver boot-vector-write HEX40\n"
                 "       device_target_driver boot-update SLOT FILE\n"
                 "       device_target_driver partition-update FILE\n");
    return 2;
}

int bootVectorWrite(const std::string& recordHex) {
    Bytes record;
    try {
        record = testing_support::fromHex(recordHex);
    } catch (const std::invalid_argument&) {
        return usage();
    }
    Storage::BootVectorTarget target;
    Storage::TargetSlot& slot = *target.getSlot(0).get();
    std::printf("write %u\n", slot.write(record.data(), record.size()));
    uint8_t buffer[20];
    std::memset(buffer, 0xEE, sizeof buffer);
    size_t count = 99;
    const Status status = slot.readSome(buffer, sizeof buffer, 0, count);
    std::printf("read %u %zu %s\n", status, count, testing_support::hex(Bytes(buffer, buffer + sizeof buffer)).c_str());
    return 0;
}

// Begins an update of `slot`, streams `data` into it and prints the first
// two results; the caller finalises.
void streamInto(Storage::TargetSlot& slot, const Bytes& data) {
    std::printf("begin %u\n", slot.beginWrite());
    Status writes = STATUS_OK;
    for (size_t offset = 0; offset < data.size() && writes == STATUS_OK; offset += 4096) {
        const size_t size = std::min<size_t>(4096, data.size() - offset);
        writes = slot.writeAt(static_cast<int64_t>(offset), data.data() + offset, size);
    }
    std::printf("writes %u\n", writes);
}

bool readFile(const char* file, Bytes& data) {
    std::ifstream in(file, std::ios::binary);
    if (!in) return false;
    data.assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
    return true;
}

int bootUpdate(const std::string& slotText, const char* file) {
    Bytes data;
    if (!readFile(file, data)) return usage();
    Storage::FirmwareUpdateBootTarget target;
    const Storage::SlotHandle handle = target.getSlot(std::strtoul(slotText.c_str(), nullptr, 10));
    if (!handle) return usage();
    Storage::TargetSlot& slot = *handle.get();
    streamInto(slot, data);
    const Status finalised = slot.finalise();
    std::printf("finalise %u valid %d\n", finalised, slot.isValid() ? 1 : 0);
    return 0;
}

int partitionUpdate(const char* file) {
    Bytes data;
    if (!readFile(file, data)) return usage();
    Storage::FirmwareUpdatePartitionTarget target;
    Storage::TargetSlot& slot = *target.getSlot(0).get();
    streamInto(slot, data);
    std::printf("finalise %u\n", slot.finalise());
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    setLogOutput(LOG_OUTPUT_STDOUT);
    setLogLevel(LOG_PRIORITY_INFO);
    if (argc == 3 && std::strcmp(argv[1], "boot-vector-write") == 0) return bootVectorWrite(argv[2]);
    if (argc == 4 && std::strcmp(argv[1], "boot-update") == 0) return bootUpdate(argv[2], argv[3]);
    if (argc == 3 && std::strcmp(argv[1], "partition-update") == 0) return partitionUpdate(argv[2]);
    return usage();
}
