#include "platform/linux/HXPendingFiles.h"

#include <unistd.h>

#include <atomic>
#include <climits>
#include <cstring>

namespace {

struct Slot {
    std::atomic<bool> isTaken = false;
    std::atomic<bool> isFilled = false;
    char path[PATH_MAX];
};
Slot slots[4];

} // namespace

void HXNotePendingFile(const std::string &path) {
    for (Slot &slot : slots) {
        if (path.size() >= sizeof slot.path || slot.isTaken.exchange(true)) continue;
        std::memcpy(slot.path, path.c_str(), path.size() + 1);
        slot.isFilled = true;
        return;
    }
}

void HXForgetPendingFile(const std::string &path) {
    for (Slot &slot : slots) {
        if (!slot.isFilled || path != slot.path) continue;
        slot.isFilled = false;
        slot.isTaken = false;
    }
}

void HXRemovePendingFiles() {
    for (Slot &slot : slots)
        if (slot.isFilled.exchange(false)) ::unlink(slot.path);
}
