// The running machine's files, work queues and signals.
#pragma once

#include "platform/HXServices.h"

#include <atomic>
#include <chrono>
#include <cstddef>

// Looks at `dispatch_apply` while it waits, on its thread.
class HXLoopObserver {
  public:
    virtual ~HXLoopObserver() = default;
    // Some times a second. `done` of `all` iterations have returned; `waitingFor`, if any, sleeps in the
    // kernel.
    virtual void looked(const HXDispatchQueue &queue, size_t done, size_t all,
                        std::optional<size_t> waitingFor) = 0;
    virtual void ended() = 0;
};

class HXLinuxServices : public HXServices {
  public:
    // Of `dispatch_apply` on queues with an activity. Null: none. Outlives its use. Main thread only.
    void setLoopObserver(HXLoopObserver *observer) { _observer = observer; }

    // How many workers `dispatch_apply` has; 0: one for each usable processor. They are batch-scheduled.
    void setWorkerCount(size_t count) { _workerCount = count; }
    // How long an iteration of `dispatch_apply` may wait in the kernel before it is given up, at least 100
    // ms; to within a hundredth.
    void setAnswerTime(std::chrono::milliseconds time) { _answerTime = time; }
    // Whether an iteration of `dispatch_apply` was given up, so that a thread may still use what it was
    // given.
    bool hasGivenUp() const { return _hasGivenUp.load(); }

    HXOptionScan getopt_long(int argc, char *const argv[], const char *shortOptions,
                             const std::vector<HXLongOption> &options, bool restart) override;
    bool stat(const std::string &path) override;
    std::FILE *openForReading(const std::string &path) override;
    std::FILE *openRegularFile(const std::string &path) override;
    std::optional<HXPendingFile> createPendingFile(const std::string &path) override;
    bool commitPendingFile(HXPendingFile &file) override;
    void discardPendingFile(HXPendingFile &file) override;
    bool isatty(int descriptor) override;
    HXDispatchQueue dispatch_queue_create(const std::string &label, uint32_t qualityOfService) override;
    std::vector<size_t> dispatch_apply(size_t iterations, const HXDispatchQueue &queue,
                                       std::function<void(size_t)> work) override;
    int finish(const char *program, int status) override;
    std::unique_ptr<HXDispatchSource> dispatch_source_create(int signal) override;
    void dispatch_source_set_event_handler(HXDispatchSource &source, std::function<void()> handler) override;
    void dispatch_resume(HXDispatchSource &source) override;
    void dispatch_source_cancel(HXDispatchSource &source) override;
    void signal(int signal, HXSignalDisposition disposition) override;

  private:
    size_t _workerCount = 0;
    std::chrono::milliseconds _answerTime{10000};
    std::atomic<bool> _hasGivenUp = false;
    HXLoopObserver *_observer = nullptr;
};
