// Command line and files; queues and signals have files of their own.
#include "platform/linux/HXLinuxServices.h"

#include "platform/linux/HXTemporaryFiles.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXTextNumber.h"

#include <fcntl.h>
#include <getopt.h>
#include <linux/magic.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <system_error>
#include <utility>

HXOptionScan HXLinuxServices::getopt_long(int argc, char *const argv[], const char *shortOptions,
                                          const std::vector<HXLongOption> &options, bool restart) {
    std::vector<option> table;
    table.reserve(options.size() + 1);
    for (const HXLongOption &entry : options)
        table.push_back(
            {entry.name, entry.hasArgument ? required_argument : no_argument, nullptr, entry.value});
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

bool HXLinuxServices::isatty(int descriptor) {
    return ::isatty(descriptor) == 1;
}

namespace {

namespace fs = std::filesystem;

// A stream over the descriptor, which it owns from then on; null with errno set.
std::FILE *openStream(HXDescriptor descriptor, const char *mode) {
    std::FILE *const stream = descriptor ? ::fdopen(descriptor.get(), mode) : nullptr;
    if (stream != nullptr) descriptor.release();
    return stream;
}

// Waits until somebody writes to the fifo, which is open without blocking, as long as it has a writer at all;
// false with errno set when none comes.
bool waitForWriter(std::FILE *fifo) {
    constexpr int patience = 10000; // ms
    pollfd wait = {::fileno(fifo), POLLIN, 0};
    if (::poll(&wait, 1, patience) == 0) {
        // Nothing to read is the end without a writer, and EAGAIN with one.
        const int c = std::fgetc(fifo);
        if (c == EOF && std::feof(fifo) != 0) {
            errno = ETIMEDOUT;
            return false;
        }
        std::clearerr(fifo);
        if (c != EOF) std::ungetc(c, fifo);
    }
    return ::fcntl(::fileno(fifo), F_SETFL, 0) == 0; // from now on reads wait
}

std::FILE *openFifo(const std::string &path) {
    std::FILE *const fifo = openStream(HXOpenAt(AT_FDCWD, path.c_str()), "r");
    if (fifo == nullptr || waitForWriter(fifo)) return fifo;
    const int error = errno;
    std::fclose(fifo);
    errno = error;
    return nullptr;
}

// Follows the symbolic links of `path`, whether or not they lead to something; not those by which the kernel
// names open files, for these need not have a path (proc(5)).
fs::path followLinks(fs::path path) {
    constexpr int mostLinks = 40; // path_resolution(7)
    std::error_code error;
    for (int links = 0; links < mostLinks && fs::is_symlink(path, error); links++) {
        const fs::path folder = path.has_parent_path() ? path.parent_path() : ".";
        struct ::statfs system;
        if (::statfs(folder.c_str(), &system) != 0 || system.f_type == PROC_SUPER_MAGIC) break;
        path = folder / fs::read_symlink(path, error);
    }
    return path;
}

// The open file of the process that `path`, its links followed, names (/dev/stdout, /dev/fd/3); none when it
// names something else. It is not opened anew: what is written follows what was, and sockets do.
std::optional<HXDescriptor> openFileAgain(const fs::path &path) {
    std::error_code error;
    const std::string name = path.filename();
    int number = 0;
    if (!HXIsNumber(name, &number) || !fs::equivalent(path.parent_path(), "/proc/self/fd", error))
        return std::nullopt;
    return HXDescriptor(::fcntl(number, F_DUPFD_CLOEXEC, 3));
}

// Opens what is no regular file for writing.
HXDescriptor openAsItStands(const fs::path &path) {
    if (auto file = openFileAgain(path)) return std::move(*file);
    return HXDescriptor(::open(path.c_str(), O_WRONLY | O_CLOEXEC | O_NOCTTY));
}

} // namespace

std::FILE *HXLinuxServices::openForReading(const std::string &path) {
    if (auto file = openFileAgain(followLinks(path))) return openStream(std::move(*file), "r");
    struct ::stat status;
    if (::stat(path.c_str(), &status) == 0 && S_ISFIFO(status.st_mode)) return openFifo(path);
    return std::fopen(path.c_str(), "re");
}

std::FILE *HXLinuxServices::openRegularFile(const std::string &path) {
    struct ::stat status;
    if (::stat(path.c_str(), &status) != 0) return nullptr;
    if (S_ISREG(status.st_mode)) {
        HXDescriptor file = HXOpenAt(AT_FDCWD, path.c_str());
        if (!file || ::fstat(file.get(), &status) != 0) return nullptr;
        if (S_ISREG(status.st_mode)) return openStream(std::move(file), "r"); // not exchanged meanwhile
    }
    errno = S_ISDIR(status.st_mode) ? EISDIR : EINVAL;
    return nullptr;
}

std::optional<HXPendingFile> HXLinuxServices::createPendingFile(const std::string &path) {
    const fs::path place = followLinks(path);
    struct ::stat status;
    const bool exists = ::lstat(place.c_str(), &status) == 0;
    const bool isNew = !exists && errno == ENOENT && place.has_filename();
    HXPendingFile file{nullptr, place, ""};
    HXDescriptor descriptor;
    if (exists && !S_ISREG(status.st_mode)) {
        descriptor = openAsItStands(place);
    } else if (isNew || (exists && ::faccessat(AT_FDCWD, place.c_str(), W_OK, AT_EACCESS) == 0)) {
        file.temporaryPath = place.parent_path() / ".heft-XXXXXX";
        descriptor = HXCreateTemporaryFile(&file.temporaryPath);
    }
    file.stream = openStream(std::move(descriptor), "w");
    if (file.stream != nullptr) return file;
    if (!file.temporaryPath.empty()) HXRemoveTemporaryFile(file.temporaryPath);
    return std::nullopt;
}

bool HXLinuxServices::commitPendingFile(HXPendingFile &file) {
    errno = 0;
    if (std::fflush(file.stream) != 0 || std::ferror(file.stream) != 0) {
        if (errno == 0) errno = EIO; // an earlier write failed, why is lost
        discardPendingFile(file);
        return false;
    }
    const bool closed = std::fclose(std::exchange(file.stream, nullptr)) == 0;
    if (file.temporaryPath.empty()) return closed;
    if (closed && HXRenameTemporaryFile(file.temporaryPath, file.path)) return true;
    HXRemoveTemporaryFile(file.temporaryPath);
    return false;
}

void HXLinuxServices::discardPendingFile(HXPendingFile &file) {
    if (file.stream == nullptr) return;
    const int kept = errno;
    std::fclose(std::exchange(file.stream, nullptr));
    if (!file.temporaryPath.empty()) HXRemoveTemporaryFile(file.temporaryPath);
    errno = kept;
}
