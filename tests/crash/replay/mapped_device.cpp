#include "mapped_device.h"

#include <fcntl.h>
#include <linux/dm-ioctl.h>
#include <sys/ioctl.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <system_error>
#include <thread>
#include <vector>

namespace replay {

namespace {

// Room for the header and a table line or a message.
constexpr size_t kBufferSize = 16384;

class Request {
public:
    explicit Request(const std::string& name) : buffer_(kBufferSize) {
        dm_ioctl& header = this->header();
        header.version[0] = DM_VERSION_MAJOR;
        header.data_size = kBufferSize;
        header.data_start = sizeof(dm_ioctl);
        if (name.size() >= sizeof header.name) throw std::invalid_argument("mapped device name too long: " + name);
        std::memcpy(header.name, name.data(), name.size());
    }

    dm_ioctl& header() { return *reinterpret_cast<dm_ioctl*>(buffer_.data()); }
    char* payload() { return buffer_.data() + sizeof(dm_ioctl); }
    size_t payloadRoom() const { return buffer_.size() - sizeof(dm_ioctl); }

    // Returns 0 or the errno of the refusal.
    int send(unsigned long command) {
        const int control = ::open("/dev/mapper/control", O_RDWR | O_CLOEXEC);
        if (control < 0) return errno;
        const int error = ::ioctl(control, command, buffer_.data()) == 0 ? 0 : errno;
        ::close(control);
        return error;
    }

    void sendOrThrow(unsigned long command, const char* what) {
        const int error = send(command);
        if (error != 0)
            throw std::system_error(error, std::generic_category(), std::string(what) + " " + header().name);
    }

private:
    // Aligned for the header's 64-bit fields.
    std::vector<char> buffer_;
};

void loadTable(const std::string& name, uint64_t sectors, const std::string& targetLine) {
    Request request(name);
    const size_t space = targetLine.find(' ');
    const std::string type = targetLine.substr(0, space);
    const std::string arguments = space == std::string::npos ? "" : targetLine.substr(space + 1);
    if (sizeof(dm_target_spec) + arguments.size() + 1 > request.payloadRoom() || type.size() >= DM_MAX_TYPE_NAME) {
        throw std::invalid_argument("table too long: " + targetLine);
    }
    auto* target = reinterpret_cast<dm_target_spec*>(request.payload());
    target->sector_start = 0;
    target->length = sectors;
    std::memcpy(target->target_type, type.data(), type.size());
    std::memcpy(request.payload() + sizeof(dm_target_spec), arguments.c_str(), arguments.size() + 1);
    request.header().target_count = 1;
    request.sendOrThrow(DM_TABLE_LOAD, "loading the table of");
}

int removeDevice(const std::string& name) {
    Request request(name);
    return request.send(DM_DEV_REMOVE);
}

}  // namespace

MappedDevice::MappedDevice(const std::string& name, uint64_t sectors, const std::string& targetLine)
    : name_(name), sectors_(sectors) {
    Request create(name);
    create.sendOrThrow(DM_DEV_CREATE, "creating");
    const dev_t device = static_cast<dev_t>(create.header().dev);
    try {
        reload(targetLine);
    } catch (...) {
        (void)removeDevice(name);
        throw;
    }
    node_ = "/dev/dm-" + std::to_string(minor(device));
}

MappedDevice::~MappedDevice() {
    // An unmount can leave the device held for a moment.
    for (int attempt = 0; attempt < 100 && removeDevice(name_) == EBUSY; ++attempt) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
}

void MappedDevice::reload(const std::string& targetLine) {
    loadTable(name_, sectors_, targetLine);
    // Resuming makes the loaded table live, suspending the device for the
    // swap when it is live already.
    Request resume(name_);
    resume.sendOrThrow(DM_DEV_SUSPEND, "resuming");
}

void MappedDevice::message(const std::string& text) const {
    Request request(name_);
    if (sizeof(dm_target_msg) + text.size() + 1 > request.payloadRoom()) {
        throw std::invalid_argument("message too long: " + text);
    }
    auto* message = reinterpret_cast<dm_target_msg*>(request.payload());
    message->sector = 0;
    std::memcpy(request.payload() + sizeof(dm_target_msg), text.c_str(), text.size() + 1);
    request.sendOrThrow(DM_TARGET_MSG, "sending a message to");
}

}  // namespace replay
