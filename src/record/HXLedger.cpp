#include "record/HXLedger.h"

#include "platform/capture/HXFixedText.h"

#include <algorithm>

std::optional<std::vector<std::string>> HXLedgerNames(HXPlatform &host) {
    constexpr int64_t firstRoom = 80, mostRoom = 1 << 16;
    std::vector<ledger_template_info> entries;
    int64_t count = firstRoom;
    // A buffer that they fill may not hold all.
    for (int64_t room = firstRoom; count == room && room <= mostRoom; room *= 2) {
        entries.resize(static_cast<size_t>(room));
        count = room;
        if (host.ledger(LEDGER_TEMPLATE_INFO, 0, entries.data(), &count) < 0) return std::nullopt;
    }
    std::vector<std::string> names;
    for (size_t i = 0; i < static_cast<size_t>(count); i++)
        names.emplace_back(HXTextOfField(entries[i].lti_name));
    return names;
}

std::optional<int64_t> HXPageTableBalance(HXPlatform &host, const std::vector<std::string> &ledgerNames,
                                          int32_t pid) {
    const auto found = std::find(ledgerNames.begin(), ledgerNames.end(), kPageTableEntry);
    const auto index = static_cast<size_t>(found - ledgerNames.begin());
    std::vector<ledger_entry_info> entries(ledgerNames.size());
    auto count = static_cast<int64_t>(entries.size());
    const bool known = found != ledgerNames.end() &&
                       host.ledger(LEDGER_ENTRY_INFO, pid, entries.data(), &count) >= 0 &&
                       index < static_cast<size_t>(count);
    return known ? std::optional(entries[index].lei_balance) : std::nullopt;
}
