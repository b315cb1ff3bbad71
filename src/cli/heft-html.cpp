// heft-html: a report as a page for a browser.
#include "platform/HXSafeText.h"
#include "report/HXCompanion.h"
#include "report/HXPageData.h"
#include "report/HXReportSource.h"

#include <filesystem>

// The page with a slot for the data, made at build time of the files in src/html.
extern const unsigned char kHXPage[];
extern const size_t kHXPageSize;

namespace {

const HXCompanion kProgram = {
    "heft-html",
    "Usage: heft-html [-o FILE] REPORT [EARLIER]\n"
    "\n"
    "A page for a browser that shows a JSON report of heft or a machine file: a map of processes and\n"
    "categories, who shares what, tables, and what changed since an earlier one. The page is one file and\n"
    "needs no network.\n"
    "\n"
    "  -o, --output FILE  write it to FILE, not to standard output\n"};

constexpr int kTrouble = 2;
constexpr std::string_view kSlot = "@DATA@";

// A page tells a document's name, not the folders that lead to it.
std::string titleOf(const std::string &path) {
    return HXSafeText(std::filesystem::path(path).filename().string());
}

int run(HXServices &services, const std::vector<std::string> &words, const std::string &output) {
    std::vector<HXReport> reports;
    for (const std::string &word : words) {
        std::string reason;
        // It lives on: a machine's replay may have had to leave a thread behind.
        static std::vector<std::unique_ptr<HXReportSource>> sources;
        const auto &source = sources.emplace_back(HXReportSource::withPath(word, &reason));
        auto report = source ? source->read(false, &reason) : std::nullopt;
        if (!report) {
            kProgram.complain(word, reason);
            return kTrouble;
        }
        reports.push_back(std::move(*report));
    }
    std::optional<HXPageReport> earlier;
    if (reports.size() > 1) earlier.emplace(HXPageReport{reports[1], titleOf(words[1])});
    const std::string data = HXPageData({reports[0], titleOf(words[0])}, earlier ? &*earlier : nullptr);

    std::string page(reinterpret_cast<const char *>(kHXPage), kHXPageSize);
    page.replace(page.find(kSlot), kSlot.size(), data);
    return kProgram.write(services, output, page, HXCompanion::Reader::owner) ? 0 : kTrouble;
}

} // namespace

int main(int argc, char *argv[]) {
    static HXLinuxPlatform own;
    HXLinuxPlatform::prepareProcess("heft-html");
    HXPlatform::setCurrent(&own);
    HXServices &services = own.services();
    services.signal(HX_SIGPIPE, HXSignalDisposition::ignored);
    std::string output;
    const std::vector<HXCompanionOption> options = {
        {"output", 'o', true,
         [&output](const std::string &argument) {
             output = argument;
             return argument.empty() ? "no file name" : "";
         }},
    };
    int status = 0;
    const auto words = kProgram.words(services, argc, argv, options, 1, 2, kTrouble, &status);
    return words ? run(services, *words, output) : status;
}
