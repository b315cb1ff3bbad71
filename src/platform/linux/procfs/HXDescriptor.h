// An open file descriptor, closed by its owner.
#pragma once

#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <span>
#include <utility>

// Before what takes the kernel long, such as a walk of page tables or a look at many pages: lets those run
// who wait for this processor (sched_yield(2)), once a millisecond. The scheduler would let them wait for its
// next tick, some milliseconds. More often would be too polite: each of them has a turn of milliseconds.
void HXGiveWay();

class HXDescriptor {
  public:
    HXDescriptor() = default;
    explicit HXDescriptor(int descriptor) : _descriptor(descriptor) {}
    HXDescriptor(HXDescriptor &&other) noexcept : _descriptor(std::exchange(other._descriptor, -1)) {}
    HXDescriptor &operator=(HXDescriptor &&other) noexcept {
        if (this != &other) reset(std::exchange(other._descriptor, -1));
        return *this;
    }
    ~HXDescriptor() { reset(); }

    int get() const { return _descriptor; }
    explicit operator bool() const { return _descriptor >= 0; }
    // Gives the ownership away.
    int release() { return std::exchange(_descriptor, -1); }
    // Keeps errno.
    void reset(int descriptor = -1);

    // One read(2), begun anew when a signal interrupts it: bytes read, 0 at the end, -1 with errno set. This
    // and `readAt` give way (HXGiveWay) before reading much.
    ssize_t read(std::span<char> buffer) const;
    // Reads from the descriptor's place until `buffer` is full or the file ends: bytes read. -1 with errno
    // set when a read fails, the first or a later one: what came before it is no answer.
    ssize_t readFully(std::span<char> buffer) const;
    // Reads up to `length` bytes from byte `position` on, which leaves the descriptor's place alone: bytes
    // read, or -1 with errno set.
    ssize_t readAt(uint64_t position, void *buffer, size_t length) const;

  private:
    int _descriptor = -1;
};

// Tells a thread whether something could not be opened for want of descriptors or memory, which must not be
// taken for something that is not there. Watches may be nested.
class HXShortageWatch {
  public:
    HXShortageWatch() : _before(_count) {}
    bool seen() const { return _count != _before; }

    // Whether `error` says that the process or the machine has run out of descriptors or memory.
    static bool isShortage(int error) { return error == EMFILE || error == ENFILE || error == ENOMEM; }
    // For whoever failed to open something: `error` is why.
    static void note(int error) { _count += isShortage(error); }

  private:
    static inline thread_local uint64_t _count = 0;
    const uint64_t _before;
};

// An open directory that names are relative to: a look at a descriptor, or AT_FDCWD.
class HXDirectoryView {
  public:
    HXDirectoryView(int descriptor) : _descriptor(descriptor) {}
    HXDirectoryView(const HXDescriptor &directory) : _descriptor(directory.get()) {}
    int get() const { return _descriptor; }

  private:
    int _descriptor;
};
