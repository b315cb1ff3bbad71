// Strings that repeat across a machine, each kept once.
#pragma once

#include <cstdint>
#include <memory>
#include <string_view>
#include <vector>

// A set of strings numbered in the order in which they were added. A string costs its bytes and about 17
// more.
class HXStringTable {
  public:
    // The number of `text`, which is added when it is new.
    uint32_t add(std::string_view text);
    // The string of a number that `add` gave; a zero follows it. It lives as long as the table.
    std::string_view text(uint32_t number) const { return view(_strings[number]); }
    const char *zeroTerminated(uint32_t number) const { return view(_strings[number]).data(); }

  private:
    // A stored string is its length (4 bytes), its bytes and a zero.
    static std::string_view view(const char *stored);
    const char *store(std::string_view text);
    void growSlots();

    std::vector<std::unique_ptr<char[]>> _blocks;
    char *_free = nullptr; // in the last block
    size_t _freeBytes = 0;
    std::vector<const char *> _strings;
    std::vector<uint32_t> _slots; // open addressing: number + 1, or 0 for none
};
