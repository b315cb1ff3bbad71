// Finds out which private pages processes share: after fork(2), by same-page merging, and in one address
// space.
#pragma once

#include "platform/HXServices.h"
#include "platform/linux/memory/HXObjectIdentifiers.h"
#include "platform/linux/pages/HXAddressSpaceReader.h"
#include "platform/linux/pages/HXLinuxTask.h"
#include "platform/linux/sharing/HXFamily.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

// What HXSharing works with; outlives it.
struct HXSharingSetting {
    HXServices *services;
    const HXReaderSetting *reader;
    HXObjectIdentifiers *identifiers;
    std::string sysPath;
    bool needsDirtyPages; // HXReadRequest::needsDirtyPages
    std::function<bool()> isCancelled;
};

class HXSharing {
  public:
    explicit HXSharing(HXSharingSetting setting) : _setting(std::move(setting)) {}

    // Reads those of the tasks that may share with others and tells each what it shares. The pids of those
    // that do not answer.
    std::set<int32_t> examine(const std::vector<HXLinuxTask *> &tasks);

    // Bytes of pages that tasks may share and `examine` told as each one's own; none when it told all.
    std::optional<uint64_t> sizeNotTold() const { return _sizeNotTold; }

  private:
    using Tasks = std::vector<HXLinuxTask *>;
    using Members = std::unordered_map<const HXLinuxTask *, HXFamilyMember>;
    struct Work;

    std::vector<Tasks> findFamilies(const Tasks &tasks);
    Tasks findMerged(const Tasks &tasks);
    HXDispatchQueue newQueue() const;
    Members readAddressSpaces(std::vector<Tasks> &families);
    std::shared_ptr<Work> open(const Tasks &tasks, Members &members);
    void readPages(std::vector<std::shared_ptr<Work>> &families, bool isSecond);
    void readFamilies(std::vector<Tasks> families);
    void give(Work &work) const;
    void measureNotTold(const std::vector<Tasks> &families);

    const HXSharingSetting _setting;
    std::shared_ptr<const HXPageEntries> _entries;
    bool _findsLazilyFreed = false; // from the frames, which takes the place of smaps
    std::set<int32_t> _unanswering;
    std::optional<uint64_t> _sizeNotTold;
};
