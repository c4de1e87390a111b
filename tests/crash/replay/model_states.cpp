#include "model_states.h"

#include <algorithm>
#include <functional>
#include <stdexcept>
#include <string_view>
#include <tuple>

namespace replay {

namespace {

bool endsWith(const std::string& text, std::string_view suffix) {
    return text.size() >= suffix.size() && text.compare(text.size() - suffix.size(), suffix.size(), suffix) == 0;
}

bool sameTime(const timespec& a, const timespec& b) { return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec; }

constexpr size_t kSectorBytes = 512;

// The directories, names, sizes and check-file order of `image`, with a
// hash of every file's bytes or without.
std::string stateKey(const crash::FsImage& image, bool withBytes) {
    std::string key;
    for (const std::string& directory : image.directories) key += "d " + directory + '\n';
    struct Check {
        timespec mtime;
        const std::string* name;
    };
    std::vector<Check> checks;
    for (const auto& [name, inode] : image.names) {
        const crash::FileNode& file = image.files.at(inode);
        const std::string_view data(reinterpret_cast<const char*>(file.data.data()), file.data.size());
        key += "f " + name + ' ' + std::to_string(file.data.size());
        if (withBytes) key += ' ' + std::to_string(std::hash<std::string_view>{}(data));
        key += '\n';
        if (endsWith(name, ".chk")) checks.push_back(Check{file.mtime, &name});
    }
    // The store picks among copies by which check file is newer, so the
    // order is all of the times it can see.
    std::sort(checks.begin(), checks.end(), [](const Check& a, const Check& b) {
        return std::tie(a.mtime.tv_sec, a.mtime.tv_nsec, *a.name) < std::tie(b.mtime.tv_sec, b.mtime.tv_nsec, *b.name);
    });
    key += "order ";
    for (size_t i = 0; i < checks.size(); ++i) {
        if (i > 0) key += sameTime(checks[i - 1].mtime, checks[i].mtime) ? '=' : '<';
        key += *checks[i].name;
    }
    return key + '\n';
}

// The bytes from the first sector in which two equally long files differ
// to the end of the last; 0 when they do not differ.
size_t differingSpan(const crash::Bytes& a, const crash::Bytes& b) {
    const size_t first = static_cast<size_t>(std::mismatch(a.begin(), a.end(), b.begin()).first - a.begin());
    if (first == a.size()) return 0;
    size_t last = a.size();
    while (a[last - 1] == b[last - 1]) --last;
    const size_t begin = first / kSectorBytes * kSectorBytes;
    const size_t end = (last + kSectorBytes - 1) / kSectorBytes * kSectorBytes;
    return end - begin;
}

// Whether `real`, of the same names and sizes as `state`, is `state` but
// for one file's bytes within `tornBytes`.
bool tornFrom(const crash::FsImage& real, const crash::FsImage& state, size_t tornBytes) {
    size_t tornFiles = 0;
    for (const auto& [name, inode] : real.names) {
        const size_t span = differingSpan(real.files.at(inode).data, state.files.at(state.names.at(name)).data);
        if (span == 0) continue;
        if (++tornFiles > 1 || span > tornBytes) return false;
    }
    return true;
}

}  // namespace

std::string visibleState(const crash::FsImage& image) { return stateKey(image, true); }

ModelStates::ModelStates(crash::FsImage durable, std::vector<crash::FsOp> ops)
    : durable_(std::move(durable)), ops_(std::move(ops)) {}

bool ModelStates::allows(const crash::FsImage& real, size_t firstCut, size_t lastCut) {
    return windowOf(firstCut, lastCut).keys.count(visibleState(real)) != 0;
}

bool ModelStates::allowsTornWrite(const crash::FsImage& real, size_t firstCut, size_t lastCut, size_t tornBytes) {
    const auto [first, end] = windowOf(firstCut, lastCut).byShape.equal_range(stateKey(real, false));
    return std::any_of(first, end, [&](const auto& entry) { return tornFrom(real, entry.second, tornBytes); });
}

size_t ModelStates::stateCount(size_t firstCut, size_t lastCut) { return windowOf(firstCut, lastCut).keys.size(); }

const ModelStates::Window& ModelStates::windowOf(size_t firstCut, size_t lastCut) {
    if (firstCut > lastCut || lastCut > ops_.size()) {
        throw std::out_of_range("no cuts from " + std::to_string(firstCut) + " to " + std::to_string(lastCut) +
                                " in a record of " + std::to_string(ops_.size()));
    }
    const auto window = std::make_pair(firstCut, lastCut);
    const auto known = windows_.find(window);
    if (known != windows_.end()) return known->second;
    Window states;
    for (size_t cut = firstCut; cut <= lastCut; ++cut) {
        crash::forEachCrashState(durable_, ops_, cut, crash::MetadataOrder::kInOrder,
                                 [&states](const crash::FsImage& state) {
                                     if (states.keys.insert(visibleState(state)).second) {
                                         states.byShape.emplace(stateKey(state, false), state);
                                     }
                                 });
    }
    return windows_.emplace(window, std::move(states)).first->second;
}

}  // namespace replay
