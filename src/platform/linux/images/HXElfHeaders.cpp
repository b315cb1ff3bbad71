#include "platform/linux/images/HXElfHeaders.h"

#include <elf.h>

#include <bit>
#include <cstring>

namespace {

constexpr uint32_t kMostHeaders = 512;                // far more than linkers make
constexpr uint64_t kAddressLimit = uint64_t{1} << 57; // of five levels of page tables; sums do not wrap

template <typename Header>
Header read(std::string_view bytes, size_t offset) {
    Header header;
    std::memcpy(&header, bytes.data() + offset, sizeof header);
    return header;
}

template <typename FileHeader, typename ProgramHeader>
std::optional<HXElfHeaderPlace> placeIn(std::string_view bytes, bool is64bit) {
    if (bytes.size() < sizeof(FileHeader)) return std::nullopt;
    const auto header = read<FileHeader>(bytes, 0);
    if (header.e_type != ET_EXEC && header.e_type != ET_DYN) return std::nullopt;
    if (header.e_phentsize != sizeof(ProgramHeader) || header.e_phnum == 0 || header.e_phnum > kMostHeaders)
        return std::nullopt;
    if (header.e_phoff < sizeof(FileHeader) || header.e_phoff >= kAddressLimit) return std::nullopt;
    return HXElfHeaderPlace{is64bit, header.e_phoff, header.e_phnum};
}

template <typename ProgramHeader>
bool isSensible(const ProgramHeader &header) {
    return header.p_filesz <= header.p_memsz && header.p_memsz < kAddressLimit &&
           header.p_vaddr < kAddressLimit && header.p_offset < kAddressLimit;
}

template <typename ProgramHeader>
std::optional<HXElfHeaders> headersIn(std::string_view bytes, const HXElfHeaderPlace &place) {
    HXElfHeaders headers;
    bool isExecutable = false;
    for (uint32_t i = 0; i < place.count; i++) {
        const auto header = read<ProgramHeader>(bytes, i * sizeof(ProgramHeader));
        if (header.p_type != PT_LOAD && header.p_type != PT_GNU_RELRO) continue;
        if (!isSensible(header)) return std::nullopt;
        if (header.p_type == PT_GNU_RELRO) {
            headers.relocatedStart = header.p_vaddr;
            headers.relocatedEnd = uint64_t{header.p_vaddr} + header.p_memsz;
            continue;
        }
        if (header.p_memsz == 0) continue;
        if (!headers.loads.empty()) {
            const HXElfLoad &previous = headers.loads.back();
            if (header.p_vaddr < previous.address + previous.memorySize) return std::nullopt;
        }
        headers.loads.push_back({header.p_offset, header.p_filesz, header.p_vaddr, header.p_memsz,
                                 (header.p_flags & PF_W) != 0, (header.p_flags & PF_X) != 0});
        isExecutable = isExecutable || headers.loads.back().executable;
    }
    if (!isExecutable) return std::nullopt;
    return headers;
}

} // namespace

uint64_t HXElfHeaderPlace::size() const {
    return uint64_t{count} * (is64bit ? sizeof(Elf64_Phdr) : sizeof(Elf32_Phdr));
}

std::optional<HXElfHeaderPlace> HXParseElfFileHeader(std::string_view bytes) {
    constexpr uint8_t native = std::endian::native == std::endian::little ? ELFDATA2LSB : ELFDATA2MSB;
    if (bytes.size() < EI_NIDENT || bytes.substr(0, SELFMAG) != ELFMAG) return std::nullopt;
    if (static_cast<uint8_t>(bytes[EI_DATA]) != native) return std::nullopt;
    if (bytes[EI_CLASS] == ELFCLASS64) return placeIn<Elf64_Ehdr, Elf64_Phdr>(bytes, true);
    if (bytes[EI_CLASS] == ELFCLASS32) return placeIn<Elf32_Ehdr, Elf32_Phdr>(bytes, false);
    return std::nullopt;
}

std::optional<HXElfHeaders> HXParseElfProgramHeaders(std::string_view bytes, const HXElfHeaderPlace &place) {
    if (bytes.size() < place.size()) return std::nullopt;
    return place.is64bit ? headersIn<Elf64_Phdr>(bytes, place) : headersIn<Elf32_Phdr>(bytes, place);
}
