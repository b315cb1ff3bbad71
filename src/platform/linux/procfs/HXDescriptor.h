// An open file descriptor, closed by its owner.
#pragma once

#include <unistd.h>

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
