#include "crash_states.h"

#include <algorithm>
#include <map>
#include <stdexcept>
#include <string>
#include <utility>

namespace crash {

namespace {

namespace fs = std::filesystem;

// Identities of files created during a record, clear of real inode numbers.
constexpr uint64_t kFirstNewFile = uint64_t{1} << 62;
constexpr size_t kMaxStates = 1000000;

bool isMetadata(FsOpKind kind) { return kind != FsOpKind::kFsync && kind != FsOpKind::kSyncfs; }

bool concernsFile(FsOpKind kind) {
    return kind != FsOpKind::kMkdir && kind != FsOpKind::kRmdir && kind != FsOpKind::kSyncfs;
}

// Operations of one file keep their order in every mode; directories count
// as files of their own.
std::string orderKey(const FsOp& op) { return concernsFile(op.kind) ? "f" + std::to_string(op.inode) : "d" + op.path; }

// The name an operation makes appear, if any.
const std::string* createdName(const FsOp& op) {
    switch (op.kind) {
        case FsOpKind::kCreate:
        case FsOpKind::kMkdir:
            return &op.path;
        case FsOpKind::kRename:
            return &op.toPath;
        default:
            return nullptr;
    }
}

bool isInside(const std::string& name, const std::string& directory) {
    return name.size() > directory.size() && name.compare(0, directory.size(), directory) == 0 &&
           name[directory.size()] == '/';
}

// One 4 KiB block of a file as it was right after a write to it: its bytes
// from the block's start up to `end`, the file's size then within the block.
struct BlockVersion {
    size_t position;  // of the write in the pending operations
    Bytes bytes;
    uint64_t end;
};

// Choice 0: no pending version; 1 to n: versions[choice - 1] landed;
// n + 1 to 2n, for a fresh block only: versions[choice - n - 1] allocated
// with its size, its data not landed.
struct Block {
    uint64_t file;
    uint64_t index;
    std::vector<BlockVersion> versions;
    size_t forcedChoice = 0;
    // The file did not reach the block before its first pending write: the
    // write allocates it.
    bool fresh = false;
};

class Enumeration {
public:
    Enumeration(const FsImage& durable, const std::vector<FsOp>& ops, size_t crashPoint, MetadataOrder order,
                const std::function<void(const FsImage&)>& visit)
        : order_(order), visit_(visit) {
        // Everything up to the last syncfs before the crash is on disk.
        size_t start = 0;
        for (size_t i = 0; i < crashPoint; ++i) {
            if (ops[i].kind == FsOpKind::kSyncfs) start = i + 1;
        }
        base_ = durable;
        for (size_t i = 0; i < start; ++i) applyOp(base_, ops[i]);
        pending_.assign(ops.begin() + static_cast<std::ptrdiff_t>(start),
                        ops.begin() + static_cast<std::ptrdiff_t>(crashPoint));
        collectBlocks();
        collectForcing();
    }

    size_t run() {
        std::vector<bool> persisted(pending_.size(), false);
        if (order_ == MetadataOrder::kInOrder) {
            std::vector<size_t> metadata;
            for (size_t p = 0; p < pending_.size(); ++p) {
                if (isMetadata(pending_[p].kind)) metadata.push_back(p);
            }
            for (size_t k = 0; k <= metadata.size(); ++k) {
                if (k > 0) persisted[metadata[k - 1]] = true;
                if (prefixHoldsForced(metadata, k)) chooseBlocks(persisted);
            }
        } else {
            groupByFile();
            chooseGroupPrefixes(0, persisted);
        }
        return visited_;
    }

private:
    void collectBlocks() {
        FsImage image = base_;
        for (size_t p = 0; p < pending_.size(); ++p) {
            const FsOp& op = pending_[p];
            const auto before = image.files.find(op.inode);
            const uint64_t sizeBefore = before == image.files.end() ? 0 : before->second.data.size();
            applyOp(image, op);
            if (op.kind != FsOpKind::kWrite || op.data.empty()) continue;
            const auto file = image.files.find(op.inode);
            if (file == image.files.end()) continue;  // written after its last name went
            const Bytes& data = file->second.data;
            const uint64_t first = static_cast<uint64_t>(op.offset) / kBlockSize;
            const uint64_t last = (static_cast<uint64_t>(op.offset) + op.data.size() - 1) / kBlockSize;
            for (uint64_t index = first; index <= last; ++index) {
                const uint64_t begin = index * kBlockSize;
                const uint64_t end = std::min<uint64_t>(begin + kBlockSize, data.size());
                Block& block = blockOf(op.inode, index);
                if (block.versions.empty()) block.fresh = sizeBefore <= begin;
                const auto from = data.begin() + static_cast<std::ptrdiff_t>(begin);
                const auto to = data.begin() + static_cast<std::ptrdiff_t>(end);
                block.versions.push_back(BlockVersion{p, Bytes(from, to), end});
            }
        }
    }

    Block& blockOf(uint64_t file, uint64_t index) {
        const auto [entry, added] = blockIndex_.try_emplace({file, index}, blocks_.size());
        if (added) blocks_.push_back(Block{file, index, {}, 0, false});
        return blocks_[entry->second];
    }

    // fsync puts one file's earlier metadata and data on disk.
    void collectForcing() {
        forced_.assign(pending_.size(), false);
        for (size_t q = 0; q < pending_.size(); ++q) {
            if (pending_[q].kind != FsOpKind::kFsync) continue;
            const uint64_t file = pending_[q].inode;
            for (size_t p = 0; p < q; ++p) {
                if (isMetadata(pending_[p].kind) && concernsFile(pending_[p].kind) && pending_[p].inode == file) {
                    forced_[p] = true;
                }
            }
            for (Block& block : blocks_) {
                if (block.file != file) continue;
                size_t before = 0;
                while (before < block.versions.size() && block.versions[before].position < q) ++before;
                block.forcedChoice = std::max(block.forcedChoice, before);
            }
        }
    }

    bool prefixHoldsForced(const std::vector<size_t>& metadata, size_t k) const {
        for (size_t i = k; i < metadata.size(); ++i) {
            if (forced_[metadata[i]]) return false;
        }
        return true;
    }

    void groupByFile() {
        std::map<std::string, size_t> groupOf;
        for (size_t p = 0; p < pending_.size(); ++p) {
            if (!isMetadata(pending_[p].kind)) continue;
            const auto [entry, added] = groupOf.try_emplace(orderKey(pending_[p]), groups_.size());
            if (added) groups_.emplace_back();
            groups_[entry->second].push_back(p);
        }
    }

    void chooseGroupPrefixes(size_t group, std::vector<bool>& persisted) {
        if (group == groups_.size()) {
            if (namesHaveTheirDirectories(persisted)) chooseBlocks(persisted);
            return;
        }
        const std::vector<size_t>& positions = groups_[group];
        std::vector<bool> chosen = persisted;
        for (size_t k = 0; k <= positions.size(); ++k) {
            if (k > 0) chosen[positions[k - 1]] = true;
            if (prefixHoldsForced(positions, k)) chooseGroupPrefixes(group + 1, chosen);
        }
    }

    // A name can only persist in a directory whose creation did.
    bool namesHaveTheirDirectories(const std::vector<bool>& persisted) const {
        for (size_t p = 0; p < pending_.size(); ++p) {
            const std::string* name = persisted[p] ? createdName(pending_[p]) : nullptr;
            if (name == nullptr) continue;
            for (size_t d = 0; d < p; ++d) {
                if (pending_[d].kind == FsOpKind::kMkdir && !persisted[d] && isInside(*name, pending_[d].path)) {
                    return false;
                }
            }
        }
        return true;
    }

    // A block version may land once the file's earlier metadata has.
    bool landable(const BlockVersion& version, uint64_t file, const std::vector<bool>& persisted) const {
        for (size_t p = 0; p < version.position; ++p) {
            const FsOp& op = pending_[p];
            if (isMetadata(op.kind) && concernsFile(op.kind) && op.inode == file && !persisted[p]) return false;
        }
        return true;
    }

    void chooseBlocks(const std::vector<bool>& persisted) {
        std::vector<std::vector<size_t>> options(blocks_.size());
        for (size_t b = 0; b < blocks_.size(); ++b) {
            const Block& block = blocks_[b];
            for (size_t choice = block.forcedChoice; choice <= block.versions.size(); ++choice) {
                if (choice == 0 || landable(block.versions[choice - 1], block.file, persisted)) {
                    options[b].push_back(choice);
                }
            }
            // Once a file's data is forced, its blocks are written: only
            // a block no fsync reached can still be an unwritten extent.
            if (block.fresh && block.forcedChoice == 0) {
                for (size_t version = 0; version < block.versions.size(); ++version) {
                    if (landable(block.versions[version], block.file, persisted)) {
                        options[b].push_back(block.versions.size() + 1 + version);
                    }
                }
            }
            if (options[b].empty()) return;
        }
        std::vector<size_t> choices(blocks_.size(), 0);
        chooseBlock(0, options, choices, persisted);
    }

    void chooseBlock(size_t b, const std::vector<std::vector<size_t>>& options, std::vector<size_t>& choices,
                     const std::vector<bool>& persisted) {
        if (b == blocks_.size()) {
            if (++visited_ > kMaxStates) throw std::runtime_error("more than a million crash states");
            visit_(replay(persisted, choices));
            return;
        }
        for (const size_t choice : options[b]) {
            choices[b] = choice;
            chooseBlock(b + 1, options, choices, persisted);
        }
    }

    FsImage replay(const std::vector<bool>& persisted, const std::vector<size_t>& choices) const {
        FsImage image = base_;
        for (size_t p = 0; p < pending_.size(); ++p) {
            const FsOp& op = pending_[p];
            if (persisted[p]) {
                if (op.kind == FsOpKind::kWrite) {
                    // A write's metadata is its time; its data lands per block.
                    const auto file = image.files.find(op.inode);
                    if (file != image.files.end()) file->second.mtime = op.mtime;
                } else {
                    applyOp(image, op);
                }
            }
            if (op.kind == FsOpKind::kWrite) landBlocks(image, p, choices);
        }
        return image;
    }

    void landBlocks(FsImage& image, size_t position, const std::vector<size_t>& choices) const {
        for (size_t b = 0; b < blocks_.size(); ++b) {
            const Block& block = blocks_[b];
            if (choices[b] == 0) continue;
            const size_t count = block.versions.size();
            const bool unwritten = choices[b] > count;
            const BlockVersion& version = block.versions[unwritten ? choices[b] - count - 1 : choices[b] - 1];
            if (version.position != position) continue;
            const auto file = image.files.find(block.file);
            if (file == image.files.end()) continue;
            Bytes& data = file->second.data;
            if (data.size() < version.end) data.resize(version.end);
            const auto begin = data.begin() + static_cast<std::ptrdiff_t>(block.index * kBlockSize);
            if (unwritten) {
                std::fill_n(begin, version.bytes.size(), uint8_t{0});
            } else {
                std::copy(version.bytes.begin(), version.bytes.end(), begin);
            }
        }
    }

    MetadataOrder order_;
    const std::function<void(const FsImage&)>& visit_;
    FsImage base_;
    std::vector<FsOp> pending_;
    std::vector<Block> blocks_;
    std::map<std::pair<uint64_t, uint64_t>, size_t> blockIndex_;
    std::vector<bool> forced_;
    std::vector<std::vector<size_t>> groups_;
    size_t visited_ = 0;
};

}  // namespace

std::vector<FsOp> prepareRecord(const std::vector<FsOp>& ops, const fs::path& root, const FsImage& durable) {
    const std::string prefix = root.string() + "/";
    auto relative = [&prefix](std::string& path) {
        if (path.compare(0, prefix.size(), prefix) != 0 || path.size() == prefix.size()) return false;
        path.erase(0, prefix.size());
        return true;
    };
    std::map<uint64_t, uint64_t> identity;
    for (const auto& [name, inode] : durable.names) identity[inode] = inode;
    uint64_t nextNew = kFirstNewFile;
    auto identify = [&identity](uint64_t inode) {
        const auto found = identity.find(inode);
        return found == identity.end() ? inode : found->second;
    };

    std::vector<FsOp> prepared;
    for (FsOp op : ops) {
        if (op.kind != FsOpKind::kSyncfs) {
            if (!relative(op.path)) continue;
            if (op.kind == FsOpKind::kRename && !relative(op.toPath)) {
                throw std::runtime_error("rename out of the recorded tree: " + describe(op));
            }
        }
        if (op.kind == FsOpKind::kCreate) {
            identity[op.inode] = nextNew;
            op.inode = nextNew++;
        } else if (concernsFile(op.kind)) {
            op.inode = identify(op.inode);
            if (op.kind == FsOpKind::kRename && op.replacedInode != 0) op.replacedInode = identify(op.replacedInode);
        }
        prepared.push_back(std::move(op));
    }
    return prepared;
}

void applyOp(FsImage& image, const FsOp& op) {
    auto fileOf = [&image](uint64_t inode) -> FileNode* {
        const auto found = image.files.find(inode);
        return found == image.files.end() ? nullptr : &found->second;
    };
    switch (op.kind) {
        case FsOpKind::kCreate:
            image.dropName(op.path);
            image.names[op.path] = op.inode;
            image.files[op.inode] = FileNode{{}, op.mtime};
            break;
        case FsOpKind::kTruncate:
            if (FileNode* file = fileOf(op.inode)) {
                file->data.resize(op.size);
                file->mtime = op.mtime;
            }
            break;
        case FsOpKind::kWrite:
            if (FileNode* file = fileOf(op.inode)) {
                const size_t end = static_cast<size_t>(op.offset) + op.data.size();
                if (file->data.size() < end) file->data.resize(end);
                std::copy(op.data.begin(), op.data.end(), file->data.begin() + op.offset);
                file->mtime = op.mtime;
            }
            break;
        case FsOpKind::kUnlink: {
            // By inode: a per-file order may already have put another file there.
            const auto found = image.names.find(op.path);
            if (found != image.names.end() && found->second == op.inode) image.dropName(op.path);
            break;
        }
        case FsOpKind::kRmdir:
            image.directories.erase(op.path);
            break;
        case FsOpKind::kMkdir:
            image.directories.insert(op.path);
            break;
        case FsOpKind::kRename:
            if (op.path == op.toPath) break;
            if (image.names.count(op.path) == 0) throw std::runtime_error("rename of an unknown file: " + describe(op));
            image.dropName(op.toPath);
            image.names[op.toPath] = image.names[op.path];
            image.names.erase(op.path);
            break;
        case FsOpKind::kUtimens:
            if (FileNode* file = fileOf(op.inode)) file->mtime = op.mtime;
            break;
        case FsOpKind::kFsync:
        case FsOpKind::kSyncfs:
        case FsOpKind::kChmod:
            break;
    }
}

size_t forEachCrashState(const FsImage& durable, const std::vector<FsOp>& ops, size_t crashPoint, MetadataOrder order,
                         const std::function<void(const FsImage&)>& visit) {
    if (crashPoint > ops.size()) throw std::out_of_range("crash point past the record");
    return Enumeration(durable, ops, crashPoint, order, visit).run();
}

}  // namespace crash
