// What a host hands out and wants back, in guards that give it back in the end. A guard must not outlive its
// host.
#pragma once

#include "platform/HXPlatform.h"

#include <memory>
#include <span>
#include <utility>

// A task, or none. Given back with `mach_port_deallocate`.
class HXTaskPort {
  public:
    explicit HXTaskPort(HXPlatform &host) : _host(&host) {}
    HXTaskPort(HXTaskPort &&other) noexcept : _host(other._host), _port(std::exchange(other._port, 0)) {}
    HXTaskPort &operator=(HXTaskPort &&other) noexcept {
        std::swap(_host, other._host);
        std::swap(_port, other._port);
        return *this;
    }
    ~HXTaskPort() { close(); }

    // Opens the task of `pid` in place of the one held. On an error, that of `task_for_pid`, none is held.
    kern_return_t open(int32_t pid) {
        close();
        const kern_return_t error = _host->task_for_pid(_host->mach_task_self(), pid, &_port);
        if (error != KERN_SUCCESS) _port = 0;
        return error;
    }
    void close() {
        if (_port != 0) _host->mach_port_deallocate(_host->mach_task_self(), std::exchange(_port, 0));
    }
    mach_port_t get() const { return _port; } // 0 for none

  private:
    HXPlatform *_host;
    mach_port_t _port = 0;
};

// A symbolicator, or null. Given back with `RVRelease`.
struct HXReleaseSymbolicator {
    HXPlatform *host;
    void operator()(RVSymbolicator *symbolicator) const { host->RVRelease(symbolicator); }
};
using HXSymbolicatorGuard = std::unique_ptr<RVSymbolicator, HXReleaseSymbolicator>;

inline HXSymbolicatorGuard HXSymbolicatorOfTask(HXPlatform &host, mach_port_t task, uint32_t flags) {
    return {host.RVSymbolicatorCreateWithTaskFlagsAndNotification(task, flags, nullptr), {&host}};
}
inline HXSymbolicatorGuard HXSymbolicatorOfKernel(HXPlatform &host, uint32_t flags) {
    return {host.RVSymbolicatorCreateWithMachKernelFlagsAndNotification(flags, nullptr), {&host}};
}

// An array that a kernel call hands out through `&array` and `&count`, which stay as they are when it fails.
// Given back with `vm_deallocate`.
template <class Record>
struct HXKernelArray {
    explicit HXKernelArray(HXPlatform &ofHost) : host(ofHost) {}
    HXKernelArray(const HXKernelArray &) = delete;
    HXKernelArray &operator=(const HXKernelArray &) = delete;
    ~HXKernelArray() { (void)release(); }

    // Gives it back early, for who wants to know whether that fails.
    kern_return_t release() {
        if (array == nullptr) return KERN_SUCCESS;
        const uint64_t bytes = uint64_t{std::exchange(count, 0)} * sizeof(Record);
        return host.vm_deallocate(host.mach_task_self(), std::exchange(array, nullptr), bytes);
    }
    std::span<Record> records() const { return {array, count}; }

    HXPlatform &host;
    Record *array = nullptr;
    uint32_t count = 0;
};
