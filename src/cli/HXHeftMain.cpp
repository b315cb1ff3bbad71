#include "cli/HXHeftMain.h"

#include "analysis/HXHeft.h"
#include "cli/HXHeftArgs.h"
#include "output/HXOutputFormatterJSON.h"
#include "output/HXOutputFormatterText.h"
#include "platform/HXPlatform.h"

#include <cctype>
#include <cerrno>
#include <memory>
#include <system_error>
#include <vector>

namespace {

// %s: the default sort column.
constexpr char kUsage[] =
    "Gather memory information about a process or set of processes\n"
    "Usage: heft [args] [proc/pid/memgraph [proc/pid/memgraph [...]]]\n"
    "\t-a, --all \t\t\t\ttarget all processes\n"
    "\t-j, --json <file> \t\t\tprint json output to a file\n"
    "\t-h, --help \t\t\t\tprint this output\n"
    "\t-p, --proc, --pid [proc/pid] \t\ttarget pid or process (or interpret for -p)\n"
    "\t-x, --exclude [proc/pid] \t\texclude pid or process\n"
    "\t-s, --skip \t\t\t\tskip processes that are idle-exit clean\n"
    "\t-v \t\t\t\t\tprint all regions and atlas-like output of address space layout "
    "(default output is a summary)\n"
    "\t-f, --format (bytes|formatted|pages) \tchange size formatting preference (default: formatted)\n"
    "\t--sort <column> \t\t\tchange the column used for sorting (default: %s)\n"
    "\t-w, --wide\t\t\t\tshow wide output with all columns and full paths (implies --swapped --wired)\n"
    "\t--swapped\t\t\t\tshow swapped/compressed column\n"
    "\t--wired\t\t\t\t\tshow wired column\n"
    "\t--vmObjectDirty\t\t\tinterpret dirty memory as viewed by VM objects in the kernel\n"
    "\t--unmapped\t\t\t\tsearch all processes for unmapped memory owned by the target processes\n";

void printUsage() {
    std::string defaultSort = HXHeftArgs::sortColumnNames().front();
    for (char &c : defaultSort)
        c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    printf(kUsage, defaultSort.c_str());
}

int optionsFailed(const HXError &error) {
    if (error.localizedDescription) fprintf(stderr, "%s\n", error.localizedDescription->c_str());
    printUsage();
    return error.domain == HXHeftError && error.code == HXErrorHelp ? 0 : 1;
}

int fileFailed(const std::string &path, int failure) {
    const std::string reason = std::error_code(failure, std::generic_category()).message();
    fprintf(stderr, "heft: %s: %s\n", path.c_str(), reason.c_str());
    return 1;
}

// An interrupt from the keyboard ends gathering early, if standard output is no terminal; a second one does
// not wait for it.
void gatherInterruptibly(HXHeft &heft) {
    HXServices &services = HXPlatform::current().services();
    const auto source = HXHeft::installCancelHandler([&heft, &services] {
        heft.cancel();
        services.signal(HX_SIGINT, HXSignalDisposition::byDefault);
        fputs("Exiting early due to SIGINT\n", stderr);
    });
    heft.gatherData();
    if (!source) return;
    services.dispatch_source_cancel(*source);
    services.signal(HX_SIGINT, HXSignalDisposition::byDefault);
}

// Never destroyed: the program ends with its report, and to give back each region first would only take time.
HXHeft &keptUntilTheEnd(HXHeft::ProcessList targets) {
    static auto &kept = *new std::vector<std::unique_ptr<HXHeft>>;
    return *kept.emplace_back(std::make_unique<HXHeft>(std::move(targets)));
}

} // namespace

int HXHeftMain(int argc, char *const argv[]) {
    HXError error;
    const auto args = HXHeftArgs::withArgc(argc, argv, &error);
    if (!args) return optionsFailed(error);
    if (args->shouldGetPhysHeftBreakdown()) HXHeft::setBreakDownPhysHeft(true);
    if ((args->targetAll() || args->searchForUnmapped()) && HXPlatform::current().geteuid() != 0) {
        fputs("Must run as root.\n", stderr);
        return 1;
    }
    HXHeft::setExaminesWholeMachine(args->targetAll() && !args->skipIdleExitClean() &&
                                    args->excludedPidsOrProcesses().empty());
    auto targets = args->targetProcessesAndError(&error);
    if (!targets) {
        fprintf(stderr, "%s\n", error.localizedDescription.value_or("").c_str());
        printUsage();
        return 1;
    }
    if (targets->empty()) {
        fputs("Unable to find any processes matching the supplied process names or pids (try as root?)\n",
              stderr);
        return 1;
    }
    // Opened before anything is gathered: a report that cannot be written is not worth waiting for.
    std::unique_ptr<HXOutputFormatterJSON> json;
    if (args->JSONOutputFile()) {
        json = HXOutputFormatterJSON::withPath(*args->JSONOutputFile());
        if (!json) return fileFailed(*args->JSONOutputFile(), errno);
        // Whoever reads the text may stop reading: the document is completed all the same.
        HXPlatform::current().services().signal(HX_SIGPIPE, HXSignalDisposition::ignored);
    }

    HXHeft &heft = keptUntilTheEnd(std::move(*targets));
    gatherInterruptibly(heft);
    HXOutputFormatterText text(args->summaryFormat(), args->textOptions(), args->textSort());
    heft.addOutputFormatter(text);
    if (json) heft.addOutputFormatter(*json);
    heft.printOutputVerbose(args->atlasLikeOutput(), args->summarize());
    if (json && json->writeError() != 0) return fileFailed(*args->JSONOutputFile(), json->writeError());
    return 0;
}
