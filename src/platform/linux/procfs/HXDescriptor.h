// An open file descriptor, closed by its owner.
#pragma once

#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <utility>

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

  private:
    int _descriptor = -1;
};

// Reads up to `length` bytes from `position` of the file on: bytes read, or -1 with errno.
inline ssize_t HXReadAt(const HXDescriptor &file, uint64_t position, void *buffer, size_t length) {
    return ::pread(file.get(), buffer, length, static_cast<off_t>(position));
}
