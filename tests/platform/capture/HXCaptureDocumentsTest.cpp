// The documents of the captures tell of every record and field that there is.
#include "platform/capture/HXMachineFormat.h"
#include "platform/capture/HXMemgraphFormat.h"
#include "support/HXBuilders.h"

#include <gtest/gtest.h>

#include <iterator>
#include <regex>
#include <set>
#include <string>
#include <utility>

namespace {

// The words of a text.
std::set<std::string> wordsOf(const std::string &text) {
    // "\fBword\fR" in a manual page.
    const std::string plain = std::regex_replace(text, std::regex(R"(\\f[BR])"), " ");
    static const std::regex word("[A-Za-z0-9_]+");
    const std::sregex_token_iterator first(plain.begin(), plain.end(), word), end;
    return {first, end};
}

void expectAll(const HXCaptureFormat &format, const std::string &text) {
    const std::set<std::string> words = wordsOf(text);
    for (const HXRecordForm &record : format.records) {
        EXPECT_TRUE(words.contains(std::string(record.word))) << record.word;
        for (const HXFieldForm &field : record.fields)
            EXPECT_TRUE(words.contains(std::string(field.name))) << record.word << " " << field.name;
    }
}

} // namespace

TEST(HXCaptureDocumentsTest, TellOfAllRecordsAndFields) {
    const std::string docs = std::string(TEST_CASES) + "/../../docs/";
    const std::pair<const char *, const char *> documents[] = {
        {"formats.md", "\n## Machine file\n"}, {"man/man5/heft-capture.5", "\n.Sh MACHINE FILE\n"}};
    for (const auto &[name, heading] : documents) {
        SCOPED_TRACE(name);
        const std::string text = contentOf(docs + name);
        const size_t machineFile = text.find(heading);
        ASSERT_NE(machineFile, std::string::npos);
        expectAll(HXMemgraphFormat::format, text.substr(0, machineFile));
        expectAll(HXMachineFormat::format, text.substr(machineFile));
    }
}
