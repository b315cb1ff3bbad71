// Where a companion's reports come from: the live machine, a machine file or a JSON document.
#pragma once

#include "platform/HXPlatform.h"
#include "platform/capture/HXMachine.h"
#include "platform/linux/HXLinuxPlatform.h"
#include "report/HXReport.h"

#include <memory>
#include <optional>
#include <string>
#include <vector>

// Lives as long as the program, whose main ends with `finish`. One thread. It sets the current platform.
class HXReportSource {
  public:
    // The live machine.
    HXReportSource() = default;
    // The file of that name, a machine file or a document by its content, read whole now; null with *reason
    // set when it cannot be read.
    static std::unique_ptr<HXReportSource> withPath(const std::string &path, std::string *reason);
    HXReportSource(const HXReportSource &) = delete;
    HXReportSource &operator=(const HXReportSource &) = delete;

    bool isLive() const { return !_machine && !_document; }
    // A report of all processes, of the live machine each time as it is then; none with *reason set when
    // there is none. With `listsRegions` it has the regions, as far as a document has them.
    std::optional<HXReport> read(bool listsRegions, std::string *reason);
    // What main returns: `status`, once standard output has been looked after (HXCompanion::finishOutput).
    // Like HXServices::finish it does not return when an iteration was given up.
    int finish(int status);

  private:
    std::unique_ptr<HXMachine> _machine;
    std::optional<std::string> _document;
    std::unique_ptr<HXLinuxPlatform> _live;              // of the last reading
    std::vector<std::unique_ptr<HXLinuxPlatform>> _kept; // those that a thread which never answered may use
};
