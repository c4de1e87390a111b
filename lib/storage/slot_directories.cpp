#include "lib/storage/slot_directories.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <cerrno>
#include <cstring>
#include <iomanip>
#include <utility>

#include "lib/storage/untrusted_tree.h"
#include "lib/util/log.h"

namespace Storage {
namespace fs = std::filesystem;
namespace {

CopyDirectory reached(int fd) {
    CopyDirectory directory;
    directory.fd = fd;
    return directory;
}

CopyDirectory notReached(int error, bool missing) {
    CopyDirectory directory;
    directory.error = error;
    directory.missing = missing;
    return directory;
}

// Opens (with `create`: makes) the directory `name` in `parent` into `out`,
// unless an earlier call of the same operation did.
CopyDirectory reachBelow(const CopyDirectory& parent, const char* name, bool create, UniqueFd& out) {
    if (out) return reached(out.get());
    if (parent.fd < 0) return parent;
    out = create ? makeDirectoryAt(parent.fd, name) : openDirectoryAt(parent.fd, name);
    if (out) return reached(out.get());
    const int error = errno;
    return notReached(error, error == ENOENT || (create && !entryExists(parent.fd, name)));
}

}  // namespace

Status CopyDirectory::computeCheckAndSync(uint64_t& value, int& syncError) const {
    syncError = 0;
    struct stat status {};
    const UniqueFd data = openToRead(kDataName, &status);
    if (data) {
        // The check file that vouches for the data must never reach the
        // disk first. Where ext4 allocates blocks as unwritten extents, its
        // journal can commit a renamed check file whose 8 bytes still read
        // as zeros, the check value of an empty file, beside a data file
        // whose new size has not landed: a valid, empty, wrong blob. The
        // checksum comes first, while the write-back that closing the data
        // file began is still under way.
        if (const Status computed = computeCheckValue(data.get(), status, value); computed != STATUS_OK) {
            return computed;
        }
        if (::fsync(data.get()) == 0) return STATUS_OK;
        syncError = errno;
        return STATUS_FAILED;
    }
    if (errno != ENOENT) return STATUS_FAILED;
    value = kAbsentBlobCheckValue;
    return STATUS_OK;
}

CheckTime CopyDirectory::checkTime() const {
    struct stat status {};
    if (fd < 0 || ::fstatat(fd, kCheckName, &status, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISREG(status.st_mode)) {
        return CheckTime{};
    }
    return checkTimeOf(status);
}

CheckIdentity CopyDirectory::checkIdentity() const {
    CheckIdentity identity;
    if (fd < 0) {
        if (!missing) identity.kind = CheckIdentity::Kind::kOther;
        return identity;
    }
    struct stat status {};
    if (::fstatat(fd, kCheckName, &status, AT_SYMLINK_NOFOLLOW) != 0) {
        if (errno != ENOENT) identity.kind = CheckIdentity::Kind::kOther;
        return identity;
    }
    return checkIdentityOf(status);
}

int CopyDirectory::remove(const char* name) const {
    if (fd < 0) return missing ? 0 : error;
    // An empty directory goes too, as std::filesystem::remove would take it.
    if (::unlinkat(fd, name, 0) == 0 || errno == ENOENT) return 0;
    if (errno != EISDIR) return errno;
    return ::unlinkat(fd, name, AT_REMOVEDIR) == 0 ? 0 : errno;
}

UniqueFd CopyDirectory::openToRead(const char* name, struct stat* status) const {
    if (fd >= 0) return openRegularAt(fd, name, O_RDONLY, 0, status);
    errno = missing ? ENOENT : error;
    return UniqueFd();
}

UniqueFd CopyDirectory::openToWrite(const char* name, int flags, mode_t mode) const {
    if (fd >= 0) return openRegularToWriteAt(fd, name, flags, mode);
    errno = missing ? ENOENT : error;
    return UniqueFd();
}

bool CopyDirectory::holds(const char* name) const { return fd >= 0 && entryExists(fd, name); }

SlotDirectories::SlotDirectories(fs::path basePath, std::string slotName, int base)
    : basePath_(std::move(basePath)), slotName_(std::move(slotName)), borrowedBase_(base) {}

CopyDirectory SlotDirectories::slot(bool create) { return reachSlot(create); }

CopyDirectory SlotDirectories::open(unsigned copy) { return reach(copy, false); }

CopyDirectory SlotDirectories::ensure(unsigned copy) {
    const CopyDirectory directory = reach(copy, true);
    if (directory.fd < 0) {
        LOGI << "Failed to create " << std::quoted(copyPath(copy).string()) << " " << std::strerror(directory.error);
    }
    return directory;
}

UniqueFd SlotDirectories::openForReading(unsigned copy, const char* name, struct stat& status) {
    if (!copies_[copy]) {
        const CopyDirectory base = reachBase(false);
        if (base.fd < 0) {
            errno = base.missing ? ENOENT : base.error;
            return UniqueFd();
        }
        const std::string path =
            (slotName_.empty() ? std::string() : slotName_ + "/") + kCopyDirectoryNames[copy] + "/" + name;
        UniqueFd fd = openRegularBeneath(base.fd, path.c_str(), O_RDONLY, &status);
        if (fd || errno != ENOSYS) return fd;
    }
    return open(copy).openToRead(name, &status);
}

fs::path SlotDirectories::copyPath(unsigned copy) const {
    return (slotName_.empty() ? basePath_ : basePath_ / slotName_) / kCopyDirectoryNames[copy];
}

CopyDirectory SlotDirectories::reach(unsigned copy, bool create) {
    return reachBelow(reachSlot(create), kCopyDirectoryNames[copy], create, copies_[copy]);
}

CopyDirectory SlotDirectories::reachSlot(bool create) {
    if (slotName_.empty()) return reachBase(create);
    return reachBelow(reachBase(create), slotName_.c_str(), create, slot_);
}

CopyDirectory SlotDirectories::reachBase(bool create) {
    if (borrowedBase_ >= 0) return reached(borrowedBase_);
    if (!base_) {
        // Followed if it is a link: the base is the integrator's, not the applications'.
        const auto openBase = [&] { base_.reset(::open(basePath_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)); };
        openBase();
        if (!base_ && errno == ENOENT && create) {
            std::error_code error;
            fs::create_directories(basePath_, error);
            if (error) return notReached(static_cast<int>(statusFromError(error)), true);
            openBase();
        }
        if (!base_) {
            const int error = errno;
            return notReached(error, error == ENOENT);
        }
    }
    return reached(base_.get());
}

}  // namespace Storage
