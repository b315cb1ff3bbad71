// The program headers of an ELF file (elf(5)). The bytes come from anywhere and are trusted in nothing.
#pragma once

#include <cstdint>
#include <optional>
#include <string_view>
#include <vector>

// Where the program headers lie, by the file's first bytes.
struct HXElfHeaderPlace {
    bool is64bit = true;
    uint64_t offset{};
    uint32_t count{};

    uint64_t size() const; // bytes
};
inline constexpr size_t HXElfFileHeaderSize = 64;
// None for what is not a native executable or shared object, or has senseless headers. `bytes`: the beginning
// of the file, HXElfFileHeaderSize bytes at least where it has as many.
std::optional<HXElfHeaderPlace> HXParseElfFileHeader(std::string_view bytes);

// A part of the file that is loaded; all in bytes, addresses before relocation.
struct HXElfLoad {
    uint64_t offset{};
    uint64_t fileSize{};
    uint64_t address{};
    uint64_t memorySize{}; // at least `fileSize`; the rest is zero-filled
    bool writable{};
    bool executable{};
};
struct HXElfHeaders {
    std::vector<HXElfLoad> loads; // ascending, not overlapping; at least one is executable
    // What is read-only once relocated; empty: nothing.
    uint64_t relocatedStart{};
    uint64_t relocatedEnd{};
};
// None when the headers make no sense. `bytes`: place.size() bytes from place.offset.
std::optional<HXElfHeaders> HXParseElfProgramHeaders(std::string_view bytes, const HXElfHeaderPlace &place);
