// A device-mapper device made through the kernel's control device, in
// process: spawning dmsetup for every crash point's device cost the replay
// most of its time on the emulated device.
#pragma once

#include <cstdint>
#include <filesystem>
#include <string>

namespace replay {

class MappedDevice {
public:
    // Creates the device `name` with the one-line table `targetLine`
    // ("TYPE ARGUMENTS" over `sectors` 512-byte sectors) and makes it
    // live. Throws std::system_error when the kernel refuses.
    MappedDevice(const std::string& name, uint64_t sectors, const std::string& targetLine);
    // Removes the device, retrying while it is briefly still busy.
    ~MappedDevice();
    MappedDevice(const MappedDevice&) = delete;
    MappedDevice& operator=(const MappedDevice&) = delete;

    // Replaces the device's table with `targetLine` over the same sectors;
    // the old target is destroyed once the new one is live. The device
    // must not be open. Throws std::system_error when the kernel refuses.
    void reload(const std::string& targetLine);

    // Sends `text` to the target (as "dmsetup message NAME 0 TEXT").
    // Throws std::system_error when the target refuses it.
    void message(const std::string& text) const;

    // The device's node (devtmpfs makes one for every mapped device).
    const std::filesystem::path& node() const { return node_; }

private:
    std::string name_;
    uint64_t sectors_;
    std::filesystem::path node_;
};

}  // namespace replay
