// What tells one page of private memory from all others: its frame, or its place in swap space, as the
// entries of pagemap have them (Documentation/admin-guide/mm/pagemap.rst).
#pragma once

#include "platform/HXAdaptiveMutex.h"
#include "platform/linux/procfs/HXDescriptor.h"

#include <array>
#include <atomic>
#include <cstdint>
#include <memory>
#include <span>
#include <unordered_map>
#include <vector>

// A frame's number, or with the top bit set the type and offset of swapped memory. 0: no page of its own.
using HXPageKey = uint64_t;
inline constexpr HXPageKey kSwappedKey = uint64_t{1} << 63;

// Reads entries of pagemap. Frames are told to those alone who have CAP_SYS_ADMIN in the first user
// namespace.
class HXPageEntries {
  public:
    // Learns the frames of the pages of zeros that all processes share from memory of the program's own,
    // which it keeps. `pageShift`: of the machine's pages.
    explicit HXPageEntries(uint32_t pageShift);
    ~HXPageEntries();
    HXPageEntries(const HXPageEntries &) = delete;
    HXPageEntries &operator=(const HXPageEntries &) = delete;

    // Whether entries tell frames at all.
    bool tellFrames() const { return _zeroFrame != 0; }

    enum Kind : uint8_t { nothing, file, anonymous, swapped };
    // What there is by an entry of a private mapping. *key: of anonymous and swapped pages, else 0.
    Kind read(uint64_t entry, HXPageKey *key) const {
        *key = 0;
        if ((entry & (kPresent | kSwapped)) == 0 || (entry & kGuard) != 0) return nothing;
        if ((entry & kPresent) == 0) return readSwapped(entry, key);
        if ((entry & kFile) != 0) return file;
        const uint64_t frame = entry & kFrame;
        if (frame == _zeroFrame || frame - _hugeZeroFrame < _hugeZeroFrames) return nothing;
        *key = frame;
        return anonymous;
    }

  private:
    static constexpr uint64_t kPresent = uint64_t{1} << 63, kSwapped = uint64_t{1} << 62,
                              kFile = uint64_t{1} << 61, kGuard = uint64_t{1} << 58,
                              kFrame = (uint64_t{1} << 55) - 1;

    static Kind readSwapped(uint64_t entry, HXPageKey *key);
    void learnZeros(uint32_t pageShift);

    uint64_t _zeroFrame = 0;
    uint64_t _hugeZeroFrame = 0;
    uint64_t _hugeZeroFrames = 0; // 0: there is no huge one
    void *_zeros = nullptr;       // where they are mapped
};

// Tells of frames by /proc/kpageflags (Documentation/admin-guide/mm/pagemap.rst). One thread at a time.
class HXFrameFlags {
  public:
    // Whether this machine tells of frames.
    static bool areTold();

    HXFrameFlags();
    // Adds to `found` those of the frames that hold private memory which needs no swapping to be dropped:
    // lazily freed, if it was not written to since. Sorts `frames`.
    void findLazilyFreed(std::vector<uint64_t> *frames, std::vector<uint64_t> *found);

  private:
    HXDescriptor _file;
    std::vector<uint64_t> _flags;
};

// Which keys have been met: a bit for each, of memory that is there where keys are. Any thread.
class HXSeenKeys {
  public:
    // A thread's way into the bits, which lie together where keys do.
    class Cursor {
      public:
        explicit Cursor(HXSeenKeys &seen) : _seen(seen) {}
        // Whether the key had been added; it is then.
        bool add(HXPageKey key) {
            const uint64_t bit = uint64_t{1} << (key & 63);
            return (wordOf(key).fetch_or(bit, std::memory_order_relaxed) & bit) != 0;
        }
        // Adds those that are not 0. What had been added, or comes twice, is appended to `metAgain`. Faster
        // by far where neighbours follow each other.
        void add(std::span<const HXPageKey> keys, std::vector<HXPageKey> *metAgain);
        bool contains(HXPageKey key) {
            return (wordOf(key).load(std::memory_order_relaxed) >> (key & 63) & 1) != 0;
        }

      private:
        std::atomic<uint64_t> &wordOf(HXPageKey key);

        HXSeenKeys &_seen;
        struct Known {
            uint64_t number = UINT64_MAX;
            std::atomic<uint64_t> *words = nullptr;
        };
        std::array<Known, 128> _known; // by the low bits of their numbers
    };

    // Forgets all keys. No thread may have a way in.
    void clear();

  private:
    static constexpr uint32_t kChunkShift = 16; // keys in a chunk: 256 MiB of frames of 4 KiB, in 8 KiB
    using Chunk = std::array<std::atomic<uint64_t>, (size_t{1} << kChunkShift) / 64>;

    std::atomic<uint64_t> *chunk(uint64_t number);

    HXAdaptiveMutex _mutex;
    std::unordered_map<uint64_t, std::unique_ptr<Chunk>> _chunks;
};
