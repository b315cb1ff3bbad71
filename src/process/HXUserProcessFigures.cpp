// A process's figures, and the reports of failed calls.
#include "platform/HXPlatform.h"
#include "process/HXUserProcess.h"

#include <cerrno>
#include <cstring>
#include <system_error>

namespace {

// Asks where "page_table" stands among the entries of every task's ledger.
void findLedgerPosition(HXPlatform &platform, HXHostCache &cache) {
    std::vector<ledger_template_info> entries;
    int64_t count = 0;
    for (int64_t room = 80;; room *= 2) {
        entries.resize(static_cast<size_t>(room));
        count = room;
        if (platform.ledger(LEDGER_TEMPLATE_INFO, 0, entries.data(), &count) < 0)
            return std::perror("Unable to retrieve ledger template info");
        if (count < room) break; // a full buffer may not hold the whole template
    }
    cache.ledgerEntryCount = count;
    for (int64_t i = 0; i < count && cache.pageTableIndex < 0; i++) {
        const ledger_template_info &entry = entries[static_cast<size_t>(i)];
        if (strncmp(entry.lti_name, "page_table", sizeof entry.lti_name) == 0) cache.pageTableIndex = i;
    }
}

} // namespace

void HXUserProcess::_gatherPhysHeft() {
    rusage_info_v4 usage{};
    if (HXPlatform::current().proc_pid_rusage(pid(), RUSAGE_INFO_V4, &usage) != 0) return;
    _phys_heft = usage.ri_phys_heft;
    _phys_heft_peak = usage.ri_lifetime_max_phys_heft;
}

void HXUserProcess::_gatherLedgers() {
    if (!breakDownPhysHeft() || !_isAlive()) return;
    HXPlatform &platform = HXPlatform::current();
    HXHostCache &cache = platform.cache();
    std::call_once(cache.ledgerTemplate, [&] { findLedgerPosition(platform, cache); });
    if (cache.pageTableIndex < 0) return;
    int64_t count = cache.ledgerEntryCount;
    std::vector<ledger_entry_info> entries(static_cast<size_t>(count));
    if (platform.ledger(LEDGER_ENTRY_INFO, pid(), entries.data(), &count) < 0)
        return _addErrnoWarningWithDescription("Unable to retrieve ledger entry info");
    if (cache.pageTableIndex >= count) return; // a reply shorter than the template tells nothing
    const int64_t balance = entries[static_cast<size_t>(cache.pageTableIndex)].lei_balance;
    _ledgers[0] = balance > 0 ? static_cast<uint64_t>(balance) : 0;
}

void HXUserProcess::_gatherIdleExitStatus() {
    if (!_isAlive()) return;
    uint32_t flags = 0;
    if (HXPlatform::current().proc_get_dirty(pid(), &flags) != 0) flags = 0;
    _setIdleExitStatusFromDirtyFlags(flags);
}

void HXUserProcess::_setIdleExitStatusFromDirtyFlags(uint32_t flags) {
    constexpr uint32_t tracked = 0x1;
    constexpr uint32_t allowsIdleExit = 0x2;
    constexpr uint32_t isDirty = 0x4;
    constexpr uint32_t idleExit = tracked | allowsIdleExit;
    if ((flags & idleExit) != idleExit)
        _idleExitStatus = HXIdleExitNotSupported;
    else
        _idleExitStatus = flags & isDirty ? HXIdleExitDirty : HXIdleExitClean;
}

HXAuxTree HXUserProcess::auxData() const {
    if (_phys_heft == 0) return nullptr;
    auto tree = std::make_shared<HXAuxDictionary>();
    tree->set("phys_heft", std::make_shared<HXAuxData>(static_cast<int64_t>(_phys_heft), false));
    tree->set("phys_heft_peak", std::make_shared<HXAuxData>(static_cast<int64_t>(_phys_heft_peak), false));
    return tree;
}

void HXUserProcess::_processMachVMError(kern_return_t error, kern_return_t expected) {
    HXPlatform &platform = HXPlatform::current();
    const char *suffix = "";
    if (error == expected) {
        proc_bsdshortinfo info{};
        errno = 0;
        const int32_t length = platform.proc_pidinfo(pid(), PROC_PIDT_SHORTBSDINFO, 1, &info, sizeof info);
        const int failure = length == static_cast<int32_t>(sizeof info) ? 0 : errno;
        if (failure == 0 && info.pbsi_status == SZOMB)
            suffix = " (zombie)";
        else if (failure == ESRCH)
            suffix = " (process exited)";
    }
    auto &list = *suffix != '\0' ? _warnings : _errors;
    list.push_back(displayString() + ": " + platform.mach_error_string(error) + suffix);
}

void HXUserProcess::_addErrnoWarningWithDescription(const std::string &description) {
    const std::string reason = std::error_code(errno, std::generic_category()).message();
    const std::string message = displayString() + ": " + description + " - " + reason;
    std::fprintf(stderr, "%s\n", message.c_str());
    _warnings.push_back(message);
}
