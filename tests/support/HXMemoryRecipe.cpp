#include "support/HXMemoryRecipe.h"

#include <fcntl.h>
#include <linux/magic.h>
#include <sys/ipc.h>
#include <sys/mman.h>
#include <sys/shm.h>
#include <sys/syscall.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <cerrno>
#include <latch>
#include <map>
#include <string>

namespace {

constexpr size_t kPage = 4096;
constexpr int kGuardInstall = 102; // MADV_GUARD_INSTALL, which not every kernel has

void require(bool holds) {
    if (!holds) _exit(1);
}

int openFile(const std::string &name, size_t size) {
    static std::map<std::string, int> files;
    const auto [known, isNew] = files.try_emplace(name, -1);
    if (!isNew) return known->second;
    int &file = known->second;
    if (name.starts_with("/proc/") || name.starts_with("/dev/zero")) {
        file = open(name.c_str(), name.starts_with("/dev/") ? O_RDWR : O_RDONLY);
    } else {
        std::string path = name + "/heft-test-XXXXXX";
        file = static_cast<int>(name == "memfd" ? syscall(SYS_memfd_create, "heft test", 0)
                                                : mkstemp(path.data()));
        unlink(path.c_str());
        require(ftruncate(file, static_cast<off_t>(size)) == 0);
    }
    require(file >= 0);
    return file;
}

void runThread(char *stack, size_t size) {
    static std::latch runs(1);
    pthread_attr_t attributes;
    pthread_t thread;
    pthread_attr_init(&attributes);
    pthread_attr_setstack(&attributes, stack, size);
    const auto run = [](void *) -> void * {
        runs.count_down();
        for (;;)
            pause();
    };
    require(pthread_create(&thread, &attributes, run, nullptr) == 0);
    runs.wait();
}

// By the kernel itself where it can be: sanitizers know nothing of that memory.
bool act(int what, char *start, size_t size) {
    if (what <= HXActProtect) return mprotect(start, size, HXActProtect - what) == 0;
    if (what == HXActLock) return syscall(SYS_mlock, start, size) == 0;
    if (what == HXActRunThread) runThread(start, size);
    return what < 0 || madvise(start, size, what) == 0 || what == kGuardInstall;
}

char *map(const HXMemoryMapping &mapping, void *place) {
    const size_t size = mapping.pages * kPage;
    if (mapping.file != nullptr && mapping.file == std::string("SysV")) {
        const int id = shmget(IPC_PRIVATE, size, IPC_CREAT | 0600);
        void *const attached = shmat(id, place, 0);
        shmctl(id, IPC_RMID, nullptr);
        return static_cast<char *>(attached);
    }
    const size_t offset = mapping.offset * kPage;
    const int file = mapping.file == nullptr ? -1 : openFile(mapping.file, offset + 2 * size);
    return static_cast<char *>(mmap(place, size, mapping.protection, mapping.flags | MAP_FIXED_NOREPLACE,
                                    file, static_cast<off_t>(offset)));
}

} // namespace

uint64_t HXPlaceOf(const HXMemoryRecipe &recipe, size_t index) {
    // Far from all that a process maps by itself, and apart, so that the kernel merges nothing with it.
    constexpr uint64_t first = 0x7ea000000000, huge = 2 << 20;
    uint64_t place = first;
    for (size_t i = 0; i < index; i++)
        place += (recipe.mappings[i].pages * kPage + 2 * huge - 1) / huge * huge;
    return place;
}

void HXFollow(const HXMemoryRecipe &recipe) {
    for (size_t i = 0; i < recipe.mappings.size(); i++) {
        const HXMemoryMapping &mapping = recipe.mappings[i];
        char *const start = map(mapping, reinterpret_cast<void *>(HXPlaceOf(recipe, i)));
        require(start == reinterpret_cast<char *>(HXPlaceOf(recipe, i)));
        for (const HXMemoryStep &step : mapping.steps) {
            const size_t count = step.count != 0 ? step.count : mapping.pages - step.first;
            const size_t length = step.every == 1 ? count : 1;
            for (size_t page = 0; page < count; page += length * step.every)
                require(act(step.act, start + (step.first + page) * kPage, length * kPage));
        }
    }
}

bool HXHasTmpfs() {
    struct ::statfs system;
    return ::statfs("/dev/shm", &system) == 0 && system.f_type == TMPFS_MAGIC;
}
