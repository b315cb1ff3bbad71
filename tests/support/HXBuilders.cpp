#include "support/HXBuilders.h"

#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

HXPrinted printedBy(const std::function<void()> &work) {
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    work();
    const std::string err = testing::internal::GetCapturedStderr();
    return {testing::internal::GetCapturedStdout(), err};
}

std::string contentOf(std::FILE *file) {
    std::string content;
    std::rewind(file);
    char part[65536];
    while (const size_t length = std::fread(part, 1, sizeof part, file))
        content.append(part, length);
    std::fclose(file);
    return content;
}

std::string contentOf(const std::string &path) {
    std::FILE *file = std::fopen(path.c_str(), "r");
    return file ? contentOf(file) : "";
}

std::string temporaryPath() {
    static HXTemporaryFolder folder;
    static int count = 0;
    return folder / std::to_string(++count);
}
