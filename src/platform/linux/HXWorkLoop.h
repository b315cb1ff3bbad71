// A loop whose iterations run on several threads, each of which may get stuck in the kernel.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <ctime>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

// The calling thread only watches: whatever a process can keep from answering is asked by a worker. (Where
// nobody can, and nobody is told how it goes, it is one of the workers.) One that waits in the kernel is soon
// joined by another, so that many that wait cost no more time than one; after the answer time it is left to
// itself. It keeps the loop alive, touches nothing but its iteration and ends after it.
class HXWorkLoop : public std::enable_shared_from_this<HXWorkLoop> {
  public:
    // Told some times a second how many iterations have returned, and which one sleeps in the kernel.
    using Look = std::function<void(size_t done, std::optional<size_t> waitingFor)>;
    // As HXServices::dispatch_apply says; without an answer time nobody is given up; `look` may be null. A
    // thread counts as waiting while it has used no processor time and sleeps; time is counted by looks at
    // it, so that nobody is given up while the program was stopped.
    static std::vector<size_t> run(size_t iterations, size_t workers,
                                   std::optional<std::chrono::milliseconds> answerTime,
                                   std::function<void(size_t)> work, const Look &look = nullptr);

    // For `run`.
    HXWorkLoop(size_t iterations, bool givesUp, std::function<void(size_t)> work)
        : _iterations(iterations), _givesUp(givesUp), _work(std::move(work)) {}

  private:
    // What the watching thread knows of a worker, under the loop's lock.
    struct Worker {
        std::thread thread = {};
        clockid_t clock = 0;                  // of the thread's processor time
        std::string statPath;                 // of the thread, in /proc
        std::optional<size_t> iteration = {}; // none: not begun, or ended
        timespec lastTime = {};
        size_t lastIteration = 0;
        int looksWithoutProgress = 0;
        bool isGivenUp = false;
        bool hasEnded = false;
    };

    // These give the lock up while a thread is started; `_workers` is changed by the watching thread alone.
    bool startWorker(std::unique_lock<std::mutex> &lock);
    void look(Worker &worker, std::unique_lock<std::mutex> &lock);
    void runWorker(Worker &worker);
    void workOnNext(std::unique_lock<std::mutex> &lock);
    void watch(std::unique_lock<std::mutex> &lock, std::chrono::milliseconds pause, const Look &observer);
    void tell(std::unique_lock<std::mutex> &lock, const Look &look) const;
    static bool hasProgressed(Worker &worker);

    const size_t _iterations;
    const bool _givesUp;
    const std::function<void(size_t)> _work;
    std::mutex _mutex;
    std::condition_variable _ended;
    // What follows, under the lock.
    size_t _next = 0;
    size_t _running = 0; // workers neither ended nor given up
    std::vector<std::unique_ptr<Worker>> _workers;
    std::vector<size_t> _givenUp;
};
