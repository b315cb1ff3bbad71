// Lookup of kernel addresses in /proc/kallsyms, and of the source positions of functions in /proc/allocinfo.
#pragma once

#include "platform/HXHostRecords.h"
#include "platform/linux/kernel/HXLinuxKernelText.h"

#include <cstdint>
#include <mutex>
#include <string>
#include <unordered_map>
#include <vector>

// The running kernel's symbolicator. Both files are read on the first lookup that needs them: kallsyms is
// several megabytes long, and seldom needed. Lookups may run concurrently.
class HXLinuxKernelSymbolicator : public RVSymbolicator {
  public:
    explicit HXLinuxKernelSymbolicator(std::string procPath) : _procPath(std::move(procPath)) {}

    // The function that holds `address`; a null name when it is in none, or the kernel hides its addresses.
    RVSymbol symbolAt(uint64_t address);

    // Where the function at `address` (or the one whose site that is, HXKernelSiteForFunction) asks for most
    // of its memory; null on kernels without allocation profiling.
    RVSourceInfo sourceAt(uint64_t address);

  private:
    struct Source {
        std::string path;
        int32_t line{};
        uint64_t size{};
    };
    void loadSymbols();
    void loadSources();
    // The code symbol that `address` lies in; null when it lies in none.
    const HXKernelSymbol *findSymbol(uint64_t address);

    const std::string _procPath;
    std::once_flag _symbolsLoaded, _sourcesLoaded;
    std::string _symbolText;
    std::vector<HXKernelSymbol> _symbols;          // views into _symbolText
    std::unordered_map<uint64_t, Source> _sources; // by site; the largest of each function
    std::mutex _namesMutex;
    std::unordered_map<uint64_t, std::string> _names; // by symbol address; what lookups handed out
};
