#include "platform/linux/sharing/HXHeldObjects.h"

#include "platform/HXRegionTags.h"
#include "platform/linux/memory/HXMappedFile.h"
#include "platform/linux/pages/HXSharedSwap.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXProcText.h"
#include "platform/linux/procfs/HXTaskFiles.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cinttypes>
#include <climits>
#include <cstdio>
#include <unordered_set>
#include <utility>

namespace {

uint32_t tagOf(HXPathKind kind) {
    switch (kind) {
    case HXPathKind::memfd:
        return HXHostTagMemfd;
    case HXPathKind::systemV:
        return HXHostTagSystemVSharedMemory;
    case HXPathKind::deletedFile:
        return HXHostTagDeletedSharedMemory;
    default:
        return HXHostTagSharedAnonymous;
    }
}

// Whether a descriptor's link names something without a name that may be in memory.
bool isNameless(std::string_view link) {
    return link.starts_with('/') && link.ends_with(" (deleted)");
}

// The mount of a process's descriptor; none when it has been closed.
std::optional<uint64_t> mountOf(const HXDescriptor &process, const std::string &descriptor) {
    char buffer[1024]; // the line is among the first, and files in memory have few
    const auto text = HXReadOnce(process, ("fdinfo/" + descriptor).c_str(), buffer);
    return text ? HXParseLabelled(*text, "mnt_id:") : std::nullopt;
}

} // namespace

// Nothing that another thread does to the descriptor or the mapping meanwhile makes this wait long: what it
// may be replaced by is not synchronised.
std::optional<HXHeldObjects::Found> HXHeldObjects::find(const HXDescriptor &process, const char *name) const {
    constexpr uint64_t blockSize = 512; // stat(2)
    constexpr unsigned wanted = STATX_TYPE | STATX_INO | STATX_NLINK | STATX_BLOCKS;
    struct statx status;
    if (::statx(process.get(), name, AT_STATX_DONT_SYNC, wanted, &status) != 0 || !S_ISREG(status.stx_mode))
        return std::nullopt;
    Found found{HXDeviceNumber(status.stx_dev_major, status.stx_dev_minor), status.stx_ino, {}};
    found.amount.size = status.stx_blocks * blockSize;
    found.amount.hasName = status.stx_nlink > 0;
    if (found.amount.size > 0 && !found.amount.hasName && _machine.usesSwap())
        found.amount.swappedSize = HXSwappedSize(HXOpenAt(process, name)).value_or(0);
    found.amount.swappedSize = std::min(found.amount.swappedSize, found.amount.size);
    return found;
}

const HXHeldObjects::Amount *HXHeldObjects::known(uint64_t object) const {
    const std::lock_guard lock(_mutex);
    const auto entry = _amounts.find(object);
    return entry == _amounts.end() ? nullptr : &entry->second;
}

// Without an amount, and with a name, the object is its file system's.
task_held_object HXHeldObjects::held(uint64_t object, uint32_t device, HXPathKind kind,
                                     const Amount *amount) {
    task_held_object record;
    record.object_id = object;
    record.container_id = _identifiers.ofFileSystem(device);
    if (!amount) return record;
    {
        const std::lock_guard lock(_mutex);
        amount = &_amounts.try_emplace(object, *amount).first->second;
    }
    if (amount->hasName) return record;
    record.resident_size = amount->size - amount->swappedSize;
    record.swapped_size = amount->swappedSize;
    record.name = std::string(HXHostTagName(tagOf(kind)).value_or("")) + " (unmapped)";
    return record;
}

std::vector<task_held_object> HXHeldObjects::mapped(const HXDescriptor &process,
                                                    const HXAddressSpace &addressSpace) {
    _places.learn(process);
    std::vector<task_held_object> all;
    std::unordered_set<uint64_t> seen;
    for (size_t i = 0; i < addressSpace.count(); i++) {
        const HXMapping &mapping = addressSpace[i];
        if (!mapping.has(HXMappingSwapBacked)) continue;
        const uint64_t object = _identifiers.ofObject(mapping, addressSpace.ipcNamespace);
        if (!seen.insert(object).second) continue;
        const Amount *amount = known(object);
        std::optional<Found> found;
        if (!amount && !mapping.has(HXMappingHasPager)) {
            char name[64];
            std::snprintf(name, sizeof name, "map_files/%" PRIx64 "-%" PRIx64, mapping.start, mapping.end);
            found = find(process, name);
            const bool isSame = found && found->inode == mapping.inode && found->device == mapping.device;
            if (isSame) amount = &found->amount;
        }
        all.push_back(held(object, mapping.device, mapping.kind, amount));
    }
    return all;
}

std::optional<std::vector<task_held_object>> HXHeldObjects::open(const HXDescriptor &descriptors) {
    std::vector<task_held_object> all;
    std::unordered_set<uint64_t> seen;
    if (!descriptors) return std::nullopt;
    bool showsAny = false;
    HXDescriptor process; // few have such descriptors
    HXForEachEntry(descriptors, [&](const char *name) {
        if (*name == '.') return true;
        showsAny = true;
        char buffer[PATH_MAX];
        const auto link = HXReadLink(descriptors, name, buffer);
        if (!link || !isNameless(*link)) return true;
        if (!process) {
            process = HXOpenAt(descriptors, "..", O_PATH | O_DIRECTORY);
            if (!process) return true;
            _places.learn(process);
        }
        const auto mount = mountOf(process, name);
        if (!mount || !_places.isMemoryMount(*mount)) return true;
        const auto found = find(process, (std::string("fd/") + name).c_str());
        if (!found) return true;
        HXMapping mapping;
        mapping.device = found->device;
        mapping.inode = found->inode;
        const bool isKernels = mapping.device == _fileSystems.sharedMemoryDevice();
        mapping.kind = isKernels ? HXPathKindOf(*link) : HXPathKind::deletedFile;
        const uint64_t space = mapping.kind == HXPathKind::systemV ? HXReadNamespace(process, "ns/ipc") : 0;
        const uint64_t object = _identifiers.ofObject(mapping, space);
        if (!seen.insert(object).second) return true;
        all.push_back(held(object, mapping.device, mapping.kind, &found->amount));
        all.back().flags = TASK_HELD_OPEN;
        return true;
    });
    return showsAny ? std::optional(std::move(all)) : std::nullopt;
}

std::vector<task_held_object> HXHeldObjects::ofKernel() {
    _places.learnOwn();
    const uint32_t kernels = _fileSystems.sharedMemoryDevice();
    const uint64_t whole = _identifiers.ofFileSystem(kernels);
    constexpr uint64_t unit = 1024;
    const auto meminfo = HXReadText(AT_FDCWD, (_procPath + "/meminfo").c_str());
    const auto shared = meminfo ? HXParseLabelled(*meminfo, "Shmem:") : std::nullopt;
    std::vector<task_held_object> all;
    if (shared)
        all.push_back({whole, 0, *shared * unit, 0, TASK_HELD_WHOLE, "shared memory without holder", ""});
    for (const HXMemoryFileSystem &fileSystem : _places.fileSystems())
        if (fileSystem.size)
            all.push_back({_identifiers.ofFileSystem(fileSystem.device), whole, *fileSystem.size, 0, 0,
                           fileSystem.name, ""});
    for (const auto &[space, segment] : _places.segments()) {
        if (segment.attachedCount > 0) continue;
        HXMapping mapping;
        mapping.device = kernels;
        mapping.inode = segment.identifier;
        mapping.kind = HXPathKind::systemV;
        all.push_back({_identifiers.ofObject(mapping, space), whole, segment.residentSize,
                       segment.swappedSize, 0, "System V shared memory (unattached)",
                       "created by process " + std::to_string(segment.creatorPid) + ", user " +
                           std::to_string(segment.creatorUser)});
    }
    return all;
}
