// What the program takes from the machine that it runs on, whatever machine it examines: its command line,
// files, work queues and signals.
//
// Unless an operation says otherwise it may be called from any thread.
#pragma once

#include <cstdint>
#include <cstdio>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

// One entry of the option table given to `getopt_long`.
struct HXLongOption {
    const char *name; // may be empty: such an option has no long form
    bool hasArgument;
    int value; // what `getopt_long` answers
};

// The scanner's state after a step of `getopt_long`.
struct HXOptionScan {
    int result = 0;                 // the option's value, '?' or ':'; -1 at the end
    const char *argument = nullptr; // the option's argument, if it has one
    int index = 1;                  // at the end: the index of the first argument that is no option
};

// A concurrent work queue; made by `dispatch_queue_create`.
struct HXDispatchQueue {
    std::string label;
    uint32_t qualityOfService = 0;
    // For whoever watches the work: what is done ("reading memory"), empty where nobody needs to know; and
    // what the process that an iteration works on is called, asked on the thread of `dispatch_apply`, may be
    // null.
    std::string activity = {};
    std::function<std::string(size_t)> processOf = {};
    // How long an iteration takes, compared with others: those that take longest may be started first, equals
    // in their order. Null: as they come.
    std::function<uint64_t(size_t)> costOf = {};
    // The work is the program's own and asks nothing of other processes: it is waited for however long it
    // takes.
    bool isOwnWork = false;
};
inline constexpr uint32_t QOS_CLASS_UTILITY = 0x11;

// A source of signal events, live until `dispatch_source_cancel`.
class HXDispatchSource {
  public:
    virtual ~HXDispatchSource() = default;
};

enum class HXSignalDisposition { byDefault, ignored };
inline constexpr int HX_SIGINT = 2;
inline constexpr int HX_SIGPIPE = 13;

// A file to write; made by `createPendingFile`.
struct HXPendingFile {
    std::FILE *stream = nullptr; // owned by the services until commit or discard
    std::string path;            // its place, links followed
    std::string temporaryPath;   // where it is written until commit; empty: at its place
};

class HXServices {
  public:
    virtual ~HXServices() = default;

    // One step of the option scanner, as getopt_long(3) does it: `shortOptions` in its notation; a first call
    // with `restart` begins at the argument after the program's name. Options and other arguments may mix;
    // the others are moved behind. What is wrong with an option is printed to standard error. Main thread
    // only.
    virtual HXOptionScan getopt_long(int argc, char *const argv[], const char *shortOptions,
                                     const std::vector<HXLongOption> &options, bool restart) = 0;

    // Whether a file system object exists at `path`; links are followed.
    virtual bool stat(const std::string &path) = 0;

    // A stream to read, which the caller closes with std::fclose, or null with errno set. Waits for a fifo's
    // writer, but for one that does not come within ten seconds no longer (ETIMEDOUT). An open file
    // of the process, such as /dev/stdin, goes on where it stands.
    virtual std::FILE *openForReading(const std::string &path) = 0;

    // The same for reading a regular file. Never waits: a folder (EISDIR) and a fifo or device (EINVAL) are
    // not even opened.
    virtual std::FILE *openRegularFile(const std::string &path) = 0;

    // Begins a file; none with errno set. A regular or new file is written beside its place, readable by its
    // owner alone, where a signal that ends the program removes it; `path` shows the old one until commit. Of
    // a symbolic link the file that it leads to is meant. Anything else (a fifo, whose reader is waited for;
    // a device; an open file of the process, such as /dev/stdout) is written as it stands.
    virtual std::optional<HXPendingFile> createPendingFile(const std::string &path) = 0;
    // Closes it and renames what was written beside its place; false with errno set when that or an earlier
    // write failed (the file is then discarded).
    virtual bool commitPendingFile(HXPendingFile &file) = 0;
    // Closes it and removes what was written beside its place; nothing when it is closed. Keeps errno.
    virtual void discardPendingFile(HXPendingFile &file) = 0;

    // Whether the stream of that descriptor (1: standard output) is a terminal.
    virtual bool isatty(int descriptor) = 0;

    virtual HXDispatchQueue dispatch_queue_create(const std::string &label, uint32_t qualityOfService) = 0;

    // Calls `work` with 0 … iterations − 1, starting them in that order (but for `costOf`), several at once.
    // Returns when each has returned or was given up: those whose thread has waited in the kernel for so
    // long, without a moment of processor time, that it may never come back. Answers the ones given up, in
    // ascending order. They go on when the kernel lets them, maybe after this has returned: whatever `work`
    // touches must be owned by it or live as long as the program, which must end with `finish`.
    // On a queue whose work is its own nothing is given up: it may use what its caller has, and may run on
    // the calling thread.
    virtual std::vector<size_t> dispatch_apply(size_t iterations, const HXDispatchQueue &queue,
                                               std::function<void(size_t)> work) = 0;

    // What main returns, once all of standard output is written: `status`; 1 when some of that is lost, which
    // is then told as `program`'s message. That nobody reads any more is no loss. Does not return when an
    // iteration was given up: the program then ends here, before the objects that it may still use are
    // destroyed.
    virtual int finish(const char *program, int status) = 0;

    // A source of events for a signal, not yet running; null when there can be none. From here until `signal`
    // sets the disposition anew the signal reaches no other thread.
    virtual std::unique_ptr<HXDispatchSource> dispatch_source_create(int signal) = 0;
    virtual void dispatch_source_set_event_handler(HXDispatchSource &source,
                                                   std::function<void()> handler) = 0;
    virtual void dispatch_resume(HXDispatchSource &source) = 0;
    // No handler runs after this has returned.
    virtual void dispatch_source_cancel(HXDispatchSource &source) = 0;

    // Sets a signal's disposition, and lets it reach the calling thread. A signal that came between
    // `dispatch_source_cancel` and this call is not lost. By default it ends the program, after what is
    // temporary of pending files has been removed; a source's handler can have the next one do so.
    virtual void signal(int signal, HXSignalDisposition disposition) = 0;
};
