// Command line and files; queues and signals have files of their own.
#include "platform/linux/HXLinuxServices.h"

#include "platform/linux/HXPendingFiles.h"
#include "platform/linux/procfs/HXProcFile.h"

#include <fcntl.h>
#include <getopt.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>

HXOptionScan HXLinuxServices::getopt_long(int argc, char *const argv[], const char *shortOptions,
                                          const std::vector<HXLongOption> &options, bool restart) {
    std::vector<option> table;
    table.reserve(options.size() + 1);
    for (const HXLongOption &entry : options)
        table.push_back(
            {entry.name, entry.hasArgument ? required_argument : no_argument, entry.flag, entry.value});
    table.push_back({});
    if (restart) optind = 0; // the C library then begins anew, whatever its last scan left behind
    optarg = nullptr;
    const int result = ::getopt_long(argc, argv, shortOptions, table.data(), nullptr);
    return {result, optarg, optind};
}

bool HXLinuxServices::stat(const std::string &path) {
    struct ::stat status;
    return ::stat(path.c_str(), &status) == 0;
}

std::FILE *HXLinuxServices::fopen(const std::string &path, const char *mode) {
    const std::string closedOnExecution = std::string(mode) + "e";
    return std::fopen(path.c_str(), closedOnExecution.c_str());
}

bool HXLinuxServices::isatty(int descriptor) {
    return ::isatty(descriptor) == 1;
}

namespace {

int otherKindError(const struct ::stat &status) {
    return S_ISDIR(status.st_mode) ? EISDIR : EINVAL;
}

void removeKeepingError(const std::string &path) {
    const int error = errno;
    ::unlink(path.c_str());
    errno = error;
}

// At most the first `most` bytes of a regular file; none with errno set, EFBIG when it has more than `limit`.
std::optional<std::string> readRegularFile(const std::string &path, uint64_t most, uint64_t limit) {
    struct ::stat status;
    const HXDescriptor file = HXOpenAt(AT_FDCWD, path.c_str());
    if (!file || ::fstat(file.get(), &status) != 0) return std::nullopt;
    const auto size = static_cast<uint64_t>(status.st_size);
    if (!S_ISREG(status.st_mode) || size > limit) {
        errno = S_ISREG(status.st_mode) ? EFBIG : otherKindError(status);
        return std::nullopt;
    }
    std::string content;
    // The size is a hint: the kernel's own files tell none, and a file may grow.
    constexpr uint64_t step = 65536;
    for (uint64_t next = size + 1;; next = std::max(step, content.size())) {
        const size_t length = content.size();
        const size_t room = std::min(next, most - length);
        content.resize(length + room);
        const ssize_t got = file.readFully(std::span(content).subspan(length));
        if (got < 0) return std::nullopt;
        content.resize(length + static_cast<size_t>(got));
        if (static_cast<size_t>(got) < room || content.size() == most) break;
    }
    if (content.size() <= limit) return content;
    errno = EFBIG;
    return std::nullopt;
}

} // namespace

std::optional<std::string> HXLinuxServices::readFileStart(const std::string &path, size_t bytes) {
    return readRegularFile(path, bytes, UINT64_MAX);
}

std::optional<std::string> HXLinuxServices::readFile(const std::string &path, uint64_t limit) {
    return readRegularFile(path, limit + 1, limit);
}

std::optional<HXPendingFile> HXLinuxServices::createPendingFile(const std::string &path) {
    // Renaming over a device or a pipe would take it away.
    struct ::stat status;
    if (::stat(path.c_str(), &status) == 0 && !S_ISREG(status.st_mode)) {
        errno = otherKindError(status);
        return std::nullopt;
    }
    HXPendingFile file;
    file.path = path;
    file.temporaryPath = path + ".XXXXXX";
    HXDescriptor descriptor(::mkostemp(file.temporaryPath.data(), O_CLOEXEC)); // mode 0600
    if (!descriptor) return std::nullopt;
    file.stream = ::fdopen(descriptor.get(), "w");
    if (file.stream == nullptr) {
        removeKeepingError(file.temporaryPath);
        return std::nullopt;
    }
    descriptor.release(); // the stream's now
    HXNotePendingFile(file.temporaryPath);
    return file;
}

bool HXLinuxServices::commitPendingFile(HXPendingFile &file) {
    // A failed write may show only in the stream's error mark or when the rest is written.
    const bool failedBefore = std::ferror(file.stream) != 0;
    const bool closed = std::fclose(file.stream) == 0;
    file.stream = nullptr;
    if (closed && failedBefore) errno = EIO;
    const bool renamed =
        closed && !failedBefore && ::rename(file.temporaryPath.c_str(), file.path.c_str()) == 0;
    if (!renamed) removeKeepingError(file.temporaryPath);
    HXForgetPendingFile(file.temporaryPath);
    return renamed;
}

void HXLinuxServices::discardPendingFile(HXPendingFile &file) {
    if (file.stream == nullptr) return;
    std::fclose(file.stream);
    file.stream = nullptr;
    ::unlink(file.temporaryPath.c_str());
    HXForgetPendingFile(file.temporaryPath);
}
