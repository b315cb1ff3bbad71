// heft-metrics: what processes hold, as OpenMetrics text.
#include "report/HXCompanion.h"
#include "report/HXMetrics.h"
#include "report/HXReportSource.h"

#include <chrono>

namespace {

const HXCompanion kProgram = {
    "heft-metrics",
    "Usage: heft-metrics [-o FILE] [-n N] [FILE.machine | REPORT.json]\n"
    "\n"
    "What commands, systemd units and categories hold, as OpenMetrics text, for the textfile collector of\n"
    "Prometheus' node exporter. Of the live machine (as root), a machine file or a JSON report of heft.\n"
    "\n"
    "  -o, --output FILE  write it there, whole or not at all, readable by all; else to standard output\n"
    "  -n, --largest N    tell the N largest of each by name (50), the rest as \"other\"\n"};

constexpr int kTrouble = 1;

struct Setting {
    std::string output; // empty: standard output
    size_t most = HXMetricsSetting().most;
};

int run(HXReportSource &source, const std::string &subject, HXServices &services, const Setting &setting) {
    const auto start = std::chrono::steady_clock::now();
    std::string reason;
    const auto report = source.read(false, &reason);
    if (!report) {
        kProgram.complain(subject, reason);
        return kTrouble;
    }
    HXProcessPlaces places;
    HXMetricsSetting metrics;
    metrics.most = setting.most;
    if (source.isLive()) metrics.places = &places;
    metrics.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    // The collector is somebody else than who writes.
    const std::string text = HXMetricsText(*report, metrics);
    return kProgram.write(services, setting.output, text, HXCompanion::Reader::everybody) ? 0 : kTrouble;
}

} // namespace

int main(int argc, char *argv[]) {
    static HXLinuxPlatform own;
    HXLinuxPlatform::prepareProcess("heft-metrics");
    HXPlatform::setCurrent(&own);
    HXServices &services = own.services();
    services.signal(HX_SIGPIPE, HXSignalDisposition::ignored);
    Setting setting;
    const std::vector<HXCompanionOption> options = {
        {"output", 'o', true,
         [&](const std::string &argument) {
             setting.output = argument;
             return "";
         }},
        {"largest", 'n', true,
         [&](const std::string &argument) -> std::string {
             const auto number = HXParseCount(argument, INT32_MAX);
             if (number) setting.most = *number;
             return number ? "" : "'" + argument + "' is no number of series";
         }},
    };
    int status = 0;
    const auto words = kProgram.words(services, argc, argv, options, 0, 1, kTrouble, &status);
    if (!words) return status;
    if (words->empty() && own.geteuid() != 0) {
        kProgram.complain("the live machine", "must run as root");
        return kTrouble;
    }
    static std::unique_ptr<HXReportSource> source;
    std::string reason;
    source = words->empty() ? std::make_unique<HXReportSource>()
                            : HXReportSource::withPath(words->front(), &reason);
    if (!source) {
        kProgram.complain(words->front(), reason);
        return kTrouble;
    }
    return source->finish(
        run(*source, words->empty() ? "the live machine" : words->front(), services, setting));
}
