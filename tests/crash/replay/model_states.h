// The crash model's states as a reader of the store tells them apart, for
// checking the states a real kernel left after a power cut against the
// model (crash_states.h).
#pragma once

#include <cstddef>
#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "crash_states.h"
#include "fs_image.h"
#include "fs_record.h"

namespace replay {

// A key of what the store can see of `image`: every directory, every file's
// name, size and a hash of its bytes, and the order of the check files'
// (names ending in ".chk") modification times, equal times told from
// increasing ones; not the times themselves, which a real run and its
// record never share. Equal keys for trees no reader of the store can tell
// apart, short of a hash collision; comparable only within one process.
std::string visibleState(const crash::FsImage& image);

// The states the model allows when the power is cut somewhere in a window
// of a record, in-order metadata.
class ModelStates {
public:
    // `ops` as crash::prepareRecord returns them for a record that started
    // from `durable`.
    ModelStates(crash::FsImage durable, std::vector<crash::FsOp> ops);

    // Whether `real` shows the same as a state the model allows after some
    // cut from `firstCut` to `lastCut`, both included (a cut is the number
    // of operations that happened). Throws std::out_of_range when
    // `firstCut` is after `lastCut` or `lastCut` past the record.
    bool allows(const crash::FsImage& real, size_t firstCut, size_t lastCut);

    // Whether `real` is a state the model allows in that window but for the
    // bytes of one file within one span of `tornBytes`, counted in whole
    // 512-byte sectors: what one device write that the cut tore leaves in
    // a file's data. The model writes whole blocks; the torn sectors may
    // hold anything (old, new, zeros, 0xFF or earlier contents).
    bool allowsTornWrite(const crash::FsImage& real, size_t firstCut, size_t lastCut, size_t tornBytes);

    // The number of states of the window that the store can tell apart.
    size_t stateCount(size_t firstCut, size_t lastCut);

private:
    struct Window {
        std::set<std::string> keys;
        // A state for each key, by its key without the files' bytes.
        std::multimap<std::string, crash::FsImage> byShape;
    };
    const Window& windowOf(size_t firstCut, size_t lastCut);

    crash::FsImage durable_;
    std::vector<crash::FsOp> ops_;
    // A replay asks the same windows for every one of its crash points.
    std::map<std::pair<size_t, size_t>, Window> windows_;
};

}  // namespace replay
