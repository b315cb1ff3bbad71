#include "platform/linux/HXTemporaryFiles.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <iterator>
#include <mutex>

namespace {

using Handler = void (*)(int);

constexpr int kEndingSignals[] = {SIGHUP,  SIGINT,  SIGQUIT, SIGABRT, SIGTERM,   SIGXFSZ,
                                  SIGXCPU, SIGALRM, SIGUSR1, SIGUSR2, SIGVTALRM, SIGPROF};

// The handler may come at any moment: it takes no lock and reads a path only while that is marked as used.
struct Slot {
    std::atomic<bool> isUsed = false;
    char path[PATH_MAX] = {};
};
static_assert(std::atomic<bool>::is_always_lock_free);
Slot slots[4];
std::mutex slotsMutex; // for changes

bool hasFiles() {
    return std::any_of(std::begin(slots), std::end(slots),
                       [](const Slot &slot) { return slot.isUsed.load(); });
}

// Only what signal-safety(7) allows.
void removeFilesAndEnd(int signal) {
    HXRemoveTemporaryFiles();
    ::signal(signal, SIG_DFL);
    ::raise(signal); // acts on return, which unblocks it
}

// A signal that something else handles, or that whoever started the program has it ignore, is left alone.
void changeHandlers(Handler from, Handler to) {
    for (const int signal : kEndingSignals) {
        struct sigaction action;
        if (::sigaction(signal, nullptr, &action) != 0 || action.sa_handler != from) continue;
        action = {};
        action.sa_handler = to;
        ::sigaction(signal, &action, nullptr);
    }
}

// More files at once than there are slots stay, should a signal end the program.
void remember(const std::string &path) {
    const auto slot =
        std::find_if(std::begin(slots), std::end(slots), [](Slot &each) { return !each.isUsed; });
    if (slot == std::end(slots) || path.size() >= sizeof slot->path) return;
    path.copy(slot->path, path.size());
    slot->path[path.size()] = '\0';
    slot->isUsed = true;
    changeHandlers(SIG_DFL, removeFilesAndEnd);
}

void forget(const std::string &path) {
    const std::lock_guard lock(slotsMutex);
    for (Slot &slot : slots)
        if (slot.isUsed && path == slot.path) slot.isUsed = false;
    if (!hasFiles()) changeHandlers(removeFilesAndEnd, SIG_DFL);
}

} // namespace

HXDescriptor HXCreateTemporaryFile(std::string *path) {
    const std::lock_guard lock(slotsMutex);
    // No signal comes between the file and its slot.
    sigset_t ending, before;
    sigemptyset(&ending);
    for (const int signal : kEndingSignals)
        sigaddset(&ending, signal);
    ::pthread_sigmask(SIG_BLOCK, &ending, &before);
    HXDescriptor file(::mkostemp(path->data(), O_CLOEXEC)); // mode 0600
    if (file)
        remember(*path);
    else
        path->clear();
    ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
    return file;
}

bool HXRenameTemporaryFile(const std::string &temporaryPath, const std::string &path) {
    if (::rename(temporaryPath.c_str(), path.c_str()) != 0) return false;
    forget(temporaryPath);
    return true;
}

void HXRemoveTemporaryFile(const std::string &temporaryPath) {
    const int kept = errno;
    ::unlink(temporaryPath.c_str());
    forget(temporaryPath);
    errno = kept;
}

void HXRemoveTemporaryFiles() {
    for (const Slot &slot : slots)
        if (slot.isUsed) ::unlink(slot.path);
}

Handler HXDefaultSignalHandler(int signal) {
    const bool ends =
        std::find(std::begin(kEndingSignals), std::end(kEndingSignals), signal) != std::end(kEndingSignals);
    return ends && hasFiles() ? removeFilesAndEnd : SIG_DFL;
}
