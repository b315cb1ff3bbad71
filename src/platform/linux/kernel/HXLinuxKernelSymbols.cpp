#include "platform/linux/kernel/HXLinuxKernelSymbols.h"

#include "platform/HXSafeText.h"
#include "platform/linux/kernel/HXLinuxKernelAccount.h"
#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>

#include <algorithm>
#include <iterator>

namespace {
// No function is longer; an address further behind the last symbol before it lies in no function, but in a
// gap that modules or generated code have left.
constexpr uint64_t kLongestFunctionSize = uint64_t{256} << 10;
} // namespace

void HXLinuxKernelSymbolicator::loadSymbols() {
    _symbolText = HXReadText(AT_FDCWD, (_procPath + "/kallsyms").c_str()).value_or("");
    _symbols = HXParseKallsyms(_symbolText);
}

void HXLinuxKernelSymbolicator::loadSources() {
    const std::string text = HXReadText(AT_FDCWD, (_procPath + "/allocinfo").c_str()).value_or("");
    for (const HXAllocationSite &site : HXParseAllocinfo(text)) {
        Source &source = _sources[HXKernelSiteForFunction(site.function, site.module)];
        if (source.path.empty() || site.size > source.size)
            source = {HXSafeText(site.path), site.line, site.size};
    }
}

const HXKernelSymbol *HXLinuxKernelSymbolicator::findSymbol(uint64_t address) {
    std::call_once(_symbolsLoaded, [this] { loadSymbols(); });
    const auto isAbove = [](uint64_t value, const HXKernelSymbol &symbol) { return value < symbol.address; };
    auto after = std::upper_bound(_symbols.begin(), _symbols.end(), address, isAbove);
    if (after == _symbols.begin()) return nullptr;
    auto symbol = std::prev(after);
    while (symbol != _symbols.begin() && std::prev(symbol)->address == symbol->address)
        --symbol;
    const bool inFunction = symbol->isCode && address - symbol->address < kLongestFunctionSize;
    return inFunction ? &*symbol : nullptr;
}

RVSymbol HXLinuxKernelSymbolicator::symbolAt(uint64_t address) {
    const HXKernelSymbol *symbol = findSymbol(address);
    if (!symbol) return {nullptr};
    const std::lock_guard lock(_namesMutex);
    const auto [entry, isNew] = _names.try_emplace(symbol->address);
    if (isNew) entry->second = HXSafeName(symbol->name);
    return {entry->second.c_str()};
}

RVSourceInfo HXLinuxKernelSymbolicator::sourceAt(uint64_t address) {
    std::call_once(_sourcesLoaded, [this] { loadSources(); });
    auto source = _sources.find(address);
    if (source == _sources.end() && !_sources.empty())
        if (const HXKernelSymbol *symbol = findSymbol(address))
            source = _sources.find(HXKernelSiteForFunction(symbol->name, symbol->module));
    if (source == _sources.end()) return {nullptr, 0, true};
    return {source->second.path.c_str(), source->second.line, false};
}
