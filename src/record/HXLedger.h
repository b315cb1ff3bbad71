// The ledgers of a host's tasks, as far as they are recorded.
#pragma once

#include "platform/HXPlatform.h"

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

// The names of the entries of every task's ledger; none when the host has no ledgers.
std::optional<std::vector<std::string>> HXLedgerNames(HXPlatform &host);

// The bytes of page tables that the ledger of `pid` tells; none when it has no such entry or cannot be read.
std::optional<int64_t> HXPageTableBalance(HXPlatform &host, const std::vector<std::string> &ledgerNames,
                                          int32_t pid);
