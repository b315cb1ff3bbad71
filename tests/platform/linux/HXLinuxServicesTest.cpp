// Work queues, signals and the command line's own files on the live host.
#include "platform/linux/HXLinuxServices.h"

#include "platform/linux/HXLinuxPlatform.h"
#include "support/HXBuilders.h"
#include "support/HXTemporaryFolder.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <sys/wait.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <filesystem>
#include <future>
#include <iterator>
#include <new>

namespace {

namespace fs = std::filesystem;

TEST(HXLinuxDispatch, LoopCallsEachIterationOnce) {
    HXLinuxServices services;
    for (const size_t workers : {0, 1, 7}) {
        services.setWorkerCount(workers);
        std::vector<std::atomic<int>> calls(100);
        const auto queue = services.dispatch_queue_create("q", QOS_CLASS_UTILITY);
        services.dispatch_apply(calls.size(), queue, [&](size_t i) { calls[i]++; });
        for (const auto &count : calls)
            EXPECT_EQ(count, 1);
        services.dispatch_apply(0, queue, [](size_t) { ADD_FAILURE(); });
    }
}

TEST(HXLinuxDispatch, WhatTakesLongestIsStartedFirst) {
    HXLinuxServices services;
    services.setWorkerCount(1);
    HXDispatchQueue queue = services.dispatch_queue_create("q", QOS_CLASS_UTILITY);
    const uint64_t costs[] = {1, 7, 1, UINT64_MAX, 7, 0};
    queue.costOf = [&](size_t i) { return costs[i]; };
    std::vector<size_t> started;
    services.dispatch_apply(std::size(costs), queue, [&](size_t i) { started.push_back(i); });
    EXPECT_EQ(started, (std::vector<size_t>{3, 1, 4, 0, 2, 5}));
}

// Waits in the kernel while the others' iterations come to an end, or uses the processor for longer than
// that.
TEST(HXLinuxDispatch, GivesUpWhatWaitsAlone) {
    HXLinuxServices services;
    services.setWorkerCount(2);
    services.setAnswerTime(std::chrono::milliseconds(100));
    const auto queue = services.dispatch_queue_create("q", QOS_CLASS_UTILITY);
    struct Shared {
        std::promise<void> answer;
        std::shared_future<void> answered{answer.get_future()};
        std::atomic<int> calls[8] = {};
        std::promise<void> lateEnd;
    };
    const auto shared = std::make_shared<Shared>();
    const auto givenUp = services.dispatch_apply(8, queue, [shared](size_t i) {
        const auto waits = i == 1 || i == 2 || i == 5;
        if (waits) shared->answered.wait();
        timespec used{};
        while (i == 3 && used.tv_sec * 1000 + used.tv_nsec / 1000000 < 150)
            clock_gettime(CLOCK_THREAD_CPUTIME_ID, &used);
        if (++shared->calls[i]; i == 2) shared->lateEnd.set_value();
    });
    EXPECT_EQ(givenUp, (std::vector<size_t>{1, 2, 5}));
    for (const size_t i : {0, 3, 4, 6, 7})
        EXPECT_EQ(shared->calls[i], 1) << i;
    shared->answer.set_value();
    shared->lateEnd.get_future().wait(); // a late one finds what it works on
}

TEST(HXLinuxDispatch, WaitsForOwnWorkHoweverLong) {
    HXLinuxServices services;
    services.setAnswerTime(std::chrono::milliseconds(100));
    HXDispatchQueue queue = services.dispatch_queue_create("q", QOS_CLASS_UTILITY);
    queue.isOwnWork = true;
    bool hasEnded = false;
    const auto givenUp = services.dispatch_apply(1, queue, [&](size_t) {
        std::promise<void>().get_future().wait_for(std::chrono::milliseconds(300));
        hasEnded = true;
    });
    EXPECT_TRUE(givenUp.empty() && hasEnded);
}

TEST(HXLinuxDispatch, TellsWhomItWaitsFor) {
    HXLinuxServices services;
    services.setWorkerCount(1);
    services.setAnswerTime(std::chrono::milliseconds(1000));
    struct Observer : HXLoopObserver {
        void looked(const HXDispatchQueue &queue, size_t done, size_t all,
                    std::optional<size_t> waitingFor) override {
            if (!waitingFor) return;
            told = queue.activity + std::to_string(done) + std::to_string(all) + std::to_string(*waitingFor);
            if (!std::exchange(isAnswered, true)) answer.set_value();
        }
        void ended() override { ends++; }
        std::string told;
        bool isAnswered = false;
        std::promise<void> answer;
        int ends = 0;
    } observer;
    services.setLoopObserver(&observer);
    HXDispatchQueue queue = services.dispatch_queue_create("q", QOS_CLASS_UTILITY);
    std::shared_future<void> answered(observer.answer.get_future());
    services.dispatch_apply(1, queue, [](size_t) {}); // nobody needs to know
    queue.activity = "x";
    services.dispatch_apply(3, queue, [answered](size_t i) {
        if (i == 2) answered.wait();
    });
    EXPECT_EQ(observer.told, "x232");
    EXPECT_EQ(observer.ends, 1);
}

// In a process of its own, for signals are the whole process's.
int statusOf(const std::function<int()> &body) {
    const pid_t child = fork();
    if (child == 0) _exit(body());
    int status = 0;
    waitpid(child, &status, 0);
    return status;
}

TEST(HXLinuxDispatch, SignalsGoToTheSourceThenToTheDisposition) {
    const int heard = statusOf([] {
        HXLinuxServices services;
        std::promise<void> came;
        const auto source = services.dispatch_source_create(SIGINT);
        services.dispatch_source_set_event_handler(*source, [&] { came.set_value(); });
        kill(getpid(), SIGINT); // before the source runs, and before the disposition changes
        services.signal(SIGINT, HXSignalDisposition::ignored);
        services.dispatch_resume(*source);
        came.get_future().wait();
        services.dispatch_source_cancel(*source);
        services.signal(SIGINT, HXSignalDisposition::byDefault);
        return 17;
    });
    EXPECT_TRUE(WIFEXITED(heard) && WEXITSTATUS(heard) == 17) << heard;
    const int ended = statusOf([] {
        HXLinuxServices services;
        const auto source = services.dispatch_source_create(SIGINT);
        services.dispatch_source_set_event_handler(*source, [] { _exit(1); });
        services.signal(SIGINT, HXSignalDisposition::ignored);
        services.dispatch_resume(*source);
        services.dispatch_source_cancel(*source);
        kill(getpid(), SIGINT); // too late for the source, too early for the disposition
        services.signal(SIGINT, HXSignalDisposition::byDefault);
        return 2;
    });
    EXPECT_TRUE(WIFSIGNALED(ended) && WTERMSIG(ended) == SIGINT) << ended;
}

// Both remove what has not got its final name yet.
TEST(HXLinuxDispatch, ASecondSignalAndLackOfMemoryEndTheProgram) {
    const HXTemporaryFolder folder;
    HXLinuxServices services;
    const int interrupted = statusOf([&] {
        const auto file = services.createPendingFile(folder / "x");
        std::promise<void> ready;
        const auto source = services.dispatch_source_create(SIGINT);
        services.dispatch_source_set_event_handler(*source, [&] {
            services.signal(SIGINT, HXSignalDisposition::byDefault);
            ready.set_value();
            std::promise<void>().get_future().wait_for(std::chrono::hours(1)); // does not return
        });
        services.dispatch_resume(*source);
        kill(getpid(), SIGINT);
        ready.get_future().wait();
        kill(getpid(), SIGINT);
        pause();
        return 2;
    });
    EXPECT_TRUE(WIFSIGNALED(interrupted) && WTERMSIG(interrupted) == SIGINT) << interrupted;
    int exhausted = -1;
    const HXPrinted printed = printedBy([&] {
        exhausted = statusOf([&] {
            HXLinuxPlatform::prepareProcess("name");
            const auto file = services.createPendingFile(folder / "x");
            services.dispatch_apply(2, {}, [](size_t) { std::get_new_handler()(); });
            return 2;
        });
    });
    EXPECT_TRUE(WIFEXITED(exhausted) && WEXITSTATUS(exhausted) == 1) << exhausted;
    EXPECT_TRUE(printed.err.starts_with("name: out of memory\n")) << printed.err;
    EXPECT_EQ(std::distance(fs::directory_iterator(folder.path()), {}), 0);
}

// Whatever is no regular file is refused at once, whether or not somebody writes to it.
TEST(HXLinuxFiles, RegularFilesAreOpenedAlone) {
    HXLinuxServices services;
    const HXTemporaryFolder folder;
    folder.write("plain", "text");
    mkfifo((folder / "fifo").c_str(), 0600);
    const std::pair<std::string, int> cases[] = {
        {folder / "fifo", EINVAL}, {"/dev/zero", EINVAL}, {folder.path(), EISDIR}, {folder / "none", ENOENT}};
    for (const auto &[path, error] : cases) {
        EXPECT_EQ(services.openRegularFile(path), nullptr) << path;
        EXPECT_EQ(errno, error) << path;
    }
    for (const std::string &path : {(folder / "plain").string(), std::string("/proc/self/status")})
        EXPECT_FALSE(contentOf(services.openRegularFile(path)).empty()) << path;
}

TEST(HXLinuxFiles, PendingFilesAppearWhole) {
    HXLinuxServices services;
    const HXTemporaryFolder folder;
    folder.write("old", "old");
    fs::permissions(folder / "old", fs::perms(0644));
    folder.link("link", "sub/../old");
    folder.link("dangling", "new");
    fs::create_directory(folder / "sub");
    for (const auto &[name, place] : {std::pair("old", "old"), {"link", "old"}, {"dangling", "new"}}) {
        const std::string before = contentOf(folder / place);
        auto discarded = services.createPendingFile(folder / name),
             file = services.createPendingFile(folder / name);
        ASSERT_TRUE(file && discarded) << name;
        for (const auto &each : {&*discarded, &*file})
            std::fputs(name, each->stream);
        services.discardPendingFile(*discarded);
        EXPECT_EQ(contentOf(folder / place), before) << name;
        EXPECT_TRUE(services.commitPendingFile(*file)) << name;
        EXPECT_EQ(contentOf(folder / place), name);
        EXPECT_EQ(fs::status(folder / place).permissions(), fs::perms(0600)) << name;
    }
    EXPECT_TRUE(fs::is_symlink(folder / "link") && fs::is_symlink(folder / "dangling"));

    auto lost = services.createPendingFile(folder / "sub" / "x");
    fs::create_directory(folder / "sub" / "x"); // in the way
    EXPECT_FALSE(services.commitPendingFile(*lost));
    EXPECT_EQ(errno, EISDIR);
    const std::pair<std::string, int> nowhere[] = {{folder / "none/x", ENOENT},
                                                   {folder / "sub", EISDIR},
                                                   {"", ENOENT},
                                                   {folder / std::string(300, 'n'), ENAMETOOLONG}};
    for (const auto &[path, error] : nowhere) {
        EXPECT_FALSE(services.createPendingFile(path)) << path;
        EXPECT_EQ(errno, error) << path;
    }
    EXPECT_EQ(std::distance(fs::directory_iterator(folder.path()), {}), 5) << "nothing is left over";
    EXPECT_EQ(std::distance(fs::directory_iterator(folder / "sub"), {}), 1);
}

// What was written to an open file before stays, and it goes on where that ended.
TEST(HXLinuxFiles, OpenFilesAreWrittenAsTheyStand) {
    HXLinuxServices services;
    const HXTemporaryFolder folder;
    std::FILE *const open = std::fopen((folder / "open").c_str(), "w");
    std::fputs("before ", open);
    std::fflush(open);
    folder.link("link", "/dev/fd/" + std::to_string(fileno(open)));
    auto file = services.createPendingFile(folder / "link");
    ASSERT_TRUE(file);
    std::fputs("after", file->stream);
    EXPECT_TRUE(services.commitPendingFile(*file));
    std::fclose(open);
    EXPECT_EQ(contentOf(folder / "open"), "before after");
}

TEST(HXLinuxFiles, SignalsLeaveTheOldFileAndNothingElse) {
    const HXTemporaryFolder folder;
    folder.write("report", "old");
    for (const int signal : {SIGINT, SIGTERM, SIGHUP}) {
        const int ended = statusOf([&] {
            HXLinuxServices services;
            auto kept = services.createPendingFile(folder / "report"),
                 gone = services.createPendingFile(folder / "gone");
            std::fputs("half", kept->stream);
            services.discardPendingFile(*gone);
            services.signal(signal, HXSignalDisposition::byDefault); // as when gathering has ended
            return raise(signal);
        });
        EXPECT_TRUE(WIFSIGNALED(ended) && WTERMSIG(ended) == signal) << ended;
        EXPECT_EQ(contentOf(folder / "report"), "old");
        EXPECT_EQ(std::distance(fs::directory_iterator(folder.path()), {}), 1) << signal;
    }
    // A signal that is ignored stays so.
    EXPECT_EQ(statusOf([&] {
                  signal(SIGHUP, SIG_IGN);
                  HXLinuxServices services;
                  auto file = services.createPendingFile(folder / "report");
                  return raise(SIGHUP);
              }),
              0);
}

} // namespace
