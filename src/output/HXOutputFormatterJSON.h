// The report as one JSON document without white space, written to a file as it arrives.
#pragma once

#include "analysis/HXOutputFormatter.h"
#include "platform/HXServices.h"

#include <cstdio>
#include <optional>
#include <string_view>
#include <unordered_set>

class HXOutputFormatterJSON : public HXOutputFormatter {
  public:
    // Opens the file and begins the document; null with errno set when the file cannot be opened. A regular
    // or new file appears, in place of an old one, when the document is complete.
    static std::unique_ptr<HXOutputFormatterJSON> withPath(const std::string &path);
    ~HXOutputFormatterJSON() override;

    void printProcessHeader(const HXProcess &process) override;
    void endProcessHeader(const HXProcess &) override {}
    void printProcessTotal(uint64_t heft, const HXProcess &process) override;
    void printProcessCategories(const HXCategoryMap &categories, const HXMemoryTotal &total) override;
    void printSharedCategories(const std::shared_ptr<const HXCategoryMap> &categories,
                               const HXProcessGroup &group, const HXProcess &process, bool hasProcessView,
                               const HXMemoryTotal &total) override;
    void printProcessAuxData(const HXAuxDictionary *data) override;
    void printProcessesWithWarnings(const Processes &withWarnings, const Processes &withErrors,
                                    const HXGlobalMessages &messages) override;
    void printSummaryCategories(const HXCategoryMap &categories, const HXMemoryTotal &total,
                                bool hadErrors) override;
    void printGlobalAuxData(const HXAuxDictionary *data) override;
    // Completes the document and closes the file; an incomplete one is discarded.
    void end() override;
    bool printsAtlasLikeOutput() const override { return true; }
    void printAtlasLikeOutputForProcess(const HXProcess &, const HXMemoryRegionList &) override {
        _verbose = true;
    }

    void JSONForCategories(const HXCategoryMap &categories);
    void JSONForAuxData(const HXAuxDictionary *data);

    // The errno of the first write that failed, known after `end`; 0 when all is written.
    int writeError() const { return _writeError; }

  private:
    struct SharedEntry {
        std::vector<int32_t> pids;
        std::shared_ptr<const HXCategoryMap> categories;
        std::optional<int32_t> specificToPid; // whose view it is
    };

    explicit HXOutputFormatterJSON(HXPendingFile file);
    void separate(); // the comma before the next key or element, where one is needed
    void key(std::string_view name);
    void open(char bracket);
    void close(char bracket);
    void raw(std::string_view json); // a value as it stands
    void number(uint64_t value);
    void text(std::string_view value);
    void texts(std::string_view name, const std::vector<std::string> &values);
    void member(std::string_view name, uint64_t value);
    void sizes(const HXMemoryTotal &total);
    void region(const HXMemoryRegion &region);
    void sharedEntry(const SharedEntry &entry);
    void flush();
    void noteFailure();

    bool _verbose = false; // region lists are written
    std::vector<SharedEntry> _shared;
    std::unordered_set<const HXProcessGroup *> _addedProcessGroups; // those without a process view
    uint32_t _pageSize = 0;                                         // that of the first process
    HXPendingFile _file;
    std::FILE *const _stream; // the file's, until `end`
    std::string _text;        // that is not handed over yet
    bool _needsComma = false;
    int _writeError = 0;
};
