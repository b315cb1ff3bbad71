// Command line and files; queues and signals are in HXLinuxServicesQueues.cpp.
#include "platform/linux/HXLinuxServices.h"

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
    HXOptionScan scan;
    scan.result = ::getopt_long(argc, argv, shortOptions, table.data(), nullptr);
    scan.argument = optarg;
    scan.index = optind;
    return scan;
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

// An open regular file and its facts; nothing, with errno set, when it is another kind of thing.
static HXDescriptor openRegularFile(const std::string &path, struct ::stat *status) {
    HXDescriptor file = HXOpenAt(AT_FDCWD, path.c_str());
    if (!file || ::fstat(file.get(), status) != 0) return {};
    if (S_ISREG(status->st_mode)) return file;
    errno = S_ISDIR(status->st_mode) ? EISDIR : EINVAL;
    return {};
}

std::optional<std::string> HXLinuxServices::readFileStart(const std::string &path, size_t bytes) {
    struct ::stat status;
    const HXDescriptor file = openRegularFile(path, &status);
    if (!file) return std::nullopt;
    std::string content(bytes, '\0');
    const ssize_t got = file.readFully(content);
    if (got < 0) return std::nullopt;
    content.resize(static_cast<size_t>(got));
    return content;
}

std::optional<std::string> HXLinuxServices::readFile(const std::string &path, uint64_t limit) {
    struct ::stat status;
    const HXDescriptor file = openRegularFile(path, &status);
    if (!file) return std::nullopt;
    if (static_cast<uint64_t>(status.st_size) > limit) {
        errno = EFBIG;
        return std::nullopt;
    }
    std::string content;
    // The size is a hint: the kernel's own files tell none, and a file may grow.
    constexpr size_t step = 65536;
    for (size_t room = static_cast<size_t>(status.st_size) + 1;; room = std::max(step, content.size())) {
        const size_t length = content.size();
        content.resize(length + room);
        const ssize_t got = file.readFully(std::span(content).subspan(length));
        if (got < 0) return std::nullopt;
        content.resize(length + static_cast<size_t>(got));
        if (content.size() > limit) {
            errno = EFBIG;
            return std::nullopt;
        }
        if (static_cast<size_t>(got) < room) return content;
    }
}

std::optional<HXPendingFile> HXLinuxServices::createPendingFile(const std::string &path) {
    // Renaming over a device or a pipe would take it away.
    struct ::stat status;
    if (::stat(path.c_str(), &status) == 0 && !S_ISREG(status.st_mode)) {
        errno = S_ISDIR(status.st_mode) ? EISDIR : EINVAL;
        return std::nullopt;
    }
    HXPendingFile file;
    file.path = path;
    file.temporaryPath = path + ".XXXXXX";
    HXDescriptor descriptor(::mkostemp(file.temporaryPath.data(), O_CLOEXEC)); // mode 0600
    if (!descriptor) return std::nullopt;
    file.stream = ::fdopen(descriptor.get(), "w");
    if (file.stream == nullptr) {
        const int error = errno;
        ::unlink(file.temporaryPath.c_str());
        errno = error;
        return std::nullopt;
    }
    descriptor.release(); // the stream's now
    return file;
}

bool HXLinuxServices::commitPendingFile(HXPendingFile &file) {
    // A failed write may show only in the stream's error mark or when the rest is written.
    const bool failedBefore = std::ferror(file.stream) != 0;
    const bool closed = std::fclose(file.stream) == 0;
    file.stream = nullptr;
    if (closed && failedBefore) errno = EIO;
    if (closed && !failedBefore && ::rename(file.temporaryPath.c_str(), file.path.c_str()) == 0) return true;
    const int error = errno;
    ::unlink(file.temporaryPath.c_str());
    errno = error;
    return false;
}

void HXLinuxServices::discardPendingFile(HXPendingFile &file) {
    if (file.stream == nullptr) return;
    std::fclose(file.stream);
    file.stream = nullptr;
    ::unlink(file.temporaryPath.c_str());
}
