#include "lib/storage/store_inspection.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <cerrno>

#include "lib/storage/slot_directories.h"
#include "lib/storage/slot_lock.h"
#include "lib/storage/untrusted_tree.h"

namespace Storage {
namespace {

EntryKind kindOf(mode_t mode) {
    if (S_ISREG(mode)) return EntryKind::kFile;
    if (S_ISDIR(mode)) return EntryKind::kDirectory;
    if (S_ISLNK(mode)) return EntryKind::kLink;
    if (S_ISFIFO(mode)) return EntryKind::kFifo;
    if (S_ISSOCK(mode)) return EntryKind::kSocket;
    return EntryKind::kDevice;
}

EntryInfo entryAt(int directory, const char* name) {
    EntryInfo entry;
    struct stat status {};
    if (::fstatat(directory, name, &status, AT_SYMLINK_NOFOLLOW) != 0) return entry;
    entry.kind = kindOf(status.st_mode);
    entry.size = status.st_size;
    entry.modified = status.st_mtim;
    return entry;
}

// Opens the directory `name` below `parent` into `out`, extending `way` by
// it; records in `copy` what stands there when it is not a directory.
bool descend(int parent, const std::string& name, std::string& way, CopyInspection& copy, UniqueFd& out) {
    way = way.empty() ? name : way + "/" + name;
    const EntryInfo entry = entryAt(parent, name.c_str());
    if (entry.kind == EntryKind::kMissing) return false;
    if (entry.kind != EntryKind::kDirectory) {
        copy.blockedAt = way;
        copy.blockedKind = entry.kind;
        return false;
    }
    // A failure here shows in the store's own judgement of the copy.
    out = openDirectoryAt(parent, name.c_str());
    return static_cast<bool>(out);
}

void describeCopy(int base, const std::string& slotName, unsigned index, CopyInspection& copy) {
    std::string way;
    UniqueFd slot;
    int parent = base;
    if (!slotName.empty()) {
        if (!descend(base, slotName, way, copy, slot)) return;
        parent = slot.get();
    }
    UniqueFd directory;
    if (!descend(parent, kCopyDirectoryNames[index], way, copy, directory)) return;
    copy.data = entryAt(directory.get(), kDataName);
    copy.checkFile = entryAt(directory.get(), kCheckName);
    copy.transient = entryAt(directory.get(), kTransientName);
    if (copy.data.kind != EntryKind::kFile) return;
    struct stat status {};
    const UniqueFd data = openRegularAt(directory.get(), kDataName, O_RDONLY, 0, &status);
    uint64_t value = 0;
    if (!data || computeCheckValue(data.get(), status, value) != STATUS_OK) {
        copy.dataError = errno;
        return;
    }
    // The CRC half of the check value; blobs stay far below 4 GiB, where
    // the size would spill into it.
    copy.crcKnown = true;
    copy.crc32 = static_cast<uint32_t>(value >> 32);
}

SlotState stateOf(const SlotInspection& slot) {
    const CopyInspection& current = slot.copies[slot.current];
    if (current.check.valid())
        return current.data.kind == EntryKind::kMissing ? SlotState::kAbsentBlob : SlotState::kPresent;
    // The entries of a copy being rewritten are not yet anything.
    const auto holds = [](const CopyInspection& copy) { return copy.hasEntries() && !copy.beingRewritten; };
    return holds(slot.copies[0]) || holds(slot.copies[1]) ? SlotState::kLost : SlotState::kEmpty;
}

// The directory's lock, shared, in `lock`: one try. Whether a change holds
// it exclusive.
bool heldByAChange(int directory, SlotLock& lock) {
    SlotLock::Outcome outcome = SlotLock::Outcome::kUnreachable;
    lock = SlotLock::take(directory, ".", LockMode::kShared, LockDeadline(), outcome);
    return outcome == SlotLock::Outcome::kBusy;
}

// Writes all of `size` bytes, resuming after short writes and signals.
int writeAll(int out, const uint8_t* bytes, size_t size) {
    while (size > 0) {
        const ssize_t written = ::write(out, bytes, size);
        if (written < 0) {
            if (errno == EINTR) continue;
            return errno;
        }
        bytes += written;
        size -= static_cast<size_t>(written);
    }
    return 0;
}

}  // namespace

const char* entryKindName(EntryKind kind) {
    switch (kind) {
        case EntryKind::kMissing:
            return "missing";
        case EntryKind::kFile:
            return "file";
        case EntryKind::kDirectory:
            return "directory";
        case EntryKind::kLink:
            return "link";
        case EntryKind::kFifo:
            return "fifo";
        case EntryKind::kSocket:
            return "socket";
        case EntryKind::kDevice:
            return "device";
    }
    return "unknown";
}

bool CopyInspection::hasEntries() const {
    return !blockedAt.empty() || data.kind != EntryKind::kMissing || checkFile.kind != EntryKind::kMissing ||
           transient.kind != EntryKind::kMissing;
}

const char* slotStateName(SlotState state) {
    switch (state) {
        case SlotState::kPresent:
            return "present";
        case SlotState::kAbsentBlob:
            return "absent-blob";
        case SlotState::kEmpty:
            return "empty";
        case SlotState::kLost:
            return "lost";
    }
    return "unknown";
}

int inspectSlot(const std::filesystem::path& targetPath, size_t slotCount, size_t index, SlotInspection& slot,
                InspectionLocks* keep) {
    SlotInspection result;
    // Followed if it is a link, as the store follows it: the integrator's choice.
    const UniqueFd base(::open(targetPath.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!base) {
        if (errno != ENOENT) return errno;
        slot = result;
        return 0;
    }
    const std::string slotName = slotDirectoryName(slotCount, index);
    SlotDirectories directories(targetPath, slotName, base.get());
    SlotLock slotLock;
    result.changeInProgress = heldByAChange(directories.slot(false).fd, slotLock);
    slotLock.release();  // tried only to tell
    InspectionLocks locks;
    for (unsigned i = 0; i < result.copies.size(); ++i) {
        result.copies[i].beingRewritten = heldByAChange(directories.open(i).fd, locks.copies[i]);
    }
    for (unsigned i = 0; i < result.copies.size(); ++i) {
        result.copies[i].check = checkCopy(directories, i);
        describeCopy(base.get(), slotName, i, result.copies[i]);
    }
    result.current = currentCopy(result.copies[0].check, result.copies[1].check);
    result.state = stateOf(result);
    slot = result;
    if (keep != nullptr) *keep = std::move(locks);
    return 0;
}

int copySlotData(const std::filesystem::path& targetPath, size_t slotCount, size_t index, unsigned copy, int out) {
    SlotDirectories directories(targetPath, slotDirectoryName(slotCount, index));
    struct stat status {};
    const UniqueFd data = directories.openForReading(copy, kDataName, status);
    if (!data) return errno;
    uint8_t block[65536];
    for (;;) {
        const ssize_t count = ::read(data.get(), block, sizeof block);
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) return errno;
        if (count == 0) return 0;
        if (const int error = writeAll(out, block, static_cast<size_t>(count))) return error;
    }
}

}  // namespace Storage
