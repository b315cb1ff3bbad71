// The options of a run, and the choice of the processes that they target.
#pragma once

#include "model/HXError.h"
#include "process/HXProcessSnapshot.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

// Strings in the order in which they were first added, each once.
class HXStringSet {
  public:
    void add(const std::string &text);
    void remove(const std::string &text);
    bool empty() const { return _strings.empty(); }
    const std::vector<std::string> &strings() const { return _strings; }

  private:
    std::vector<std::string> _strings;
};

// Codes of HXHeftError.
enum HXHeftErrorCode {
    HXErrorHelp = 1,
    HXErrorFormat = 2,
    HXErrorSort = 3,
    HXErrorPid = 4,
    HXErrorOption = 5,
    HXErrorConflictingMemgraph = 6,
    HXErrorMemgraph = 7,
    HXErrorNoTarget = 8,
};

class HXHeftArgs {
  public:
    using ProcessList = std::vector<std::unique_ptr<HXProcess>>;

    // Parses the command line; prints warnings and notices to standard error. None with *error (may be null)
    // set when it cannot be taken.
    static std::unique_ptr<HXHeftArgs> withArgc(int argc, char *const argv[], HXError *error);

    // The titles of the columns, in order; the first is the default sort column.
    static const std::vector<std::string> &sortColumnNames();

    // The records to analyse: those of memory graphs in command-line order, then live ones by ascending pid;
    // may be empty. None with *error (may be null) set. May fix the analysis mode and consume the target
    // descriptions.
    std::optional<ProcessList> targetProcessesAndError(HXError *error);

    bool targetChildren() const { return _targetChildren; }
    bool targetAll() const { return _targetAll; }
    bool skipIdleExitClean() const { return _skipIdleExitClean; }
    bool atlasLikeOutput() const { return _atlasLikeOutput; }
    bool summarize() const { return !_atlasLikeOutput; }
    bool shouldGetPhysHeftBreakdown() const { return _shouldGetPhysHeftBreakdown; }
    bool didSetShouldGetPhysHeftBreakdown() const { return _didSetShouldGetPhysHeftBreakdown; }
    bool searchForUnmapped() const { return _searchForUnmapped; }
    int32_t summaryFormat() const { return _summaryFormat; } // HXSummaryFormat
    int32_t textOptions() const { return _textOptions; }     // HXTextOptions
    const std::string &textSort() const { return _textSort; }
    const std::optional<std::string> &JSONOutputFile() const { return _JSONOutputFile; }
    const HXPidDescriptions &targetPids() const { return _targetPids; }
    const HXStringSet &potentialTargetProcesses() const { return _potentialTargetProcesses; }
    const HXStringSet &excludedPidsOrProcesses() const { return _excludedPidsOrProcesses; }

  private:
    struct Option;
    struct Choice;

    // Every step that can fail answers false with *error (may be null) set.
    static bool fail(HXError *error, HXHeftErrorCode code,
                     std::optional<std::string> description = std::nullopt);
    bool take(const Option &option, const char *argument, HXError *error);
    bool takeHelp(const std::string &argument, HXError *error);
    bool takeFormat(const std::string &argument, HXError *error);
    bool takeSort(const std::string &argument, HXError *error);
    bool takePid(const std::string &argument, HXError *error);
    bool takeVmObjectDirty(const std::string &argument, HXError *error);
    void reconcile();

    bool loadMemgraphs(Choice &choice, HXError *error);
    bool takeMemgraph(const std::string &path, Choice &choice, HXError *error);
    void sayWhatIsNotTold() const;
    HXProcess::Map liveTargets(HXProcessSnapshot &snapshot);
    std::set<int32_t> exclusions(HXProcessSnapshot &snapshot) const;
    void resolveDescriptions(HXProcessSnapshot &snapshot);
    void addChildren(HXProcessSnapshot &snapshot);
    void addTargets(HXProcessSnapshot &snapshot, HXProcess::Map &processes) const;

    bool _targetChildren = false;
    bool _targetAll = false;
    bool _skipIdleExitClean = false;
    bool _atlasLikeOutput = false;
    bool _shouldGetPhysHeftBreakdown = true;
    bool _didSetShouldGetPhysHeftBreakdown = false;
    bool _searchForUnmapped = false;
    int32_t _summaryFormat = 1;
    int32_t _textOptions = 0;
    std::string _textSort = sortColumnNames().front();
    std::optional<std::string> _JSONOutputFile;
    HXPidDescriptions _targetPids;
    HXStringSet _potentialTargetProcesses; // still to be resolved: names, pids or paths
    HXStringSet _excludedPidsOrProcesses;
};
