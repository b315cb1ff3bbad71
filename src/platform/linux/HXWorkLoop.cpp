#include "platform/linux/HXWorkLoop.h"

#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXProcText.h"

#include <fcntl.h>
#include <pthread.h>
#include <sched.h>

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <system_error>

namespace {

constexpr int kLooks = 100;                                // without progress, until an iteration is given up
constexpr std::chrono::milliseconds kPauseWithoutEnd{100}; // between looks where none is
constexpr int kPatientLooks = 3;                           // until another worker joins

// The stat file of the calling thread, by its number in the namespace that /proc is of.
std::string ownStatPath() {
    char link[PATH_MAX];
    const auto thread = HXReadLink(AT_FDCWD, "/proc/thread-self", link);
    return thread ? "/proc/" + std::string(*thread) + "/stat" : std::string();
}

// Whether the thread sleeps, for a signal or without. One that may run but gets no processor does not, nor
// does one that is stopped.
bool isAsleep(const std::string &statPath) {
    char buffer[2048]; // 52 numbers and a short name
    const auto text = HXReadOnce(AT_FDCWD, statPath.c_str(), buffer);
    const auto stat = text ? HXParseStat(*text) : std::nullopt;
    return !stat || stat->state == 'S' || stat->state == 'D';
}

// A thread's heap grows by a page or two at a time, each time with a system call (mprotect) that keeps other
// threads from touching new pages: 500 of them in a run. What has once been taken from it stays usable when
// it is free again, and takes no memory before it is touched. See HXLinuxPlatform::prepareProcess.
void makeRoom() {
    constexpr size_t size = 4 << 20;
    void *volatile taken = std::malloc(size); // volatile, or the compiler leaves out both calls
    std::free(taken);
}

} // namespace

std::vector<size_t> HXWorkLoop::run(size_t iterations, size_t workers,
                                    std::optional<std::chrono::milliseconds> answerTime,
                                    std::function<void(size_t)> work, const Look &look) {
    const auto loop = std::make_shared<HXWorkLoop>(iterations, answerTime.has_value(), std::move(work));
    std::unique_lock lock(loop->_mutex);
    // Where nothing is given up and nobody is told, nobody needs to watch.
    const bool takesPart = !answerTime && !look;
    for (size_t i = takesPart ? 1 : 0; i < std::min(iterations, workers); i++)
        if (loop->_next == loop->_iterations || !loop->startWorker(lock)) break;
    while (takesPart && loop->_next < loop->_iterations)
        loop->workOnNext(lock);
    const auto pause =
        answerTime ? std::max(*answerTime / kLooks, std::chrono::milliseconds(1)) : kPauseWithoutEnd;
    loop->watch(lock, pause, look);
    lock.unlock(); // no worker starts from here on
    for (const auto &worker : loop->_workers)
        worker->isGivenUp ? worker->thread.detach() : worker->thread.join();
    std::sort(loop->_givenUp.begin(), loop->_givenUp.end());
    return loop->_givenUp;
}

// False when no thread may be had: those that run share the work.
bool HXWorkLoop::startWorker(std::unique_lock<std::mutex> &lock) {
    Worker &worker = *_workers.emplace_back(std::make_unique<Worker>());
    _running++;
    lock.unlock();
    std::thread thread;
    try {
        thread = std::thread([loop = shared_from_this(), &worker] { loop->runWorker(worker); });
    } catch (const std::system_error &) {
    }
    lock.lock();
    const bool isStarted = thread.joinable();
    worker.thread = std::move(thread);
    if (isStarted) return true;
    _workers.pop_back();
    _running--;
    return false;
}

void HXWorkLoop::runWorker(Worker &worker) {
    const sched_param parameter{};
    ::pthread_setschedparam(::pthread_self(), SCHED_BATCH, &parameter);
    worker.statPath = ownStatPath();
    ::pthread_getcpuclockid(::pthread_self(), &worker.clock);
    makeRoom();
    std::unique_lock lock(_mutex);
    while (!worker.isGivenUp && _next < _iterations) {
        worker.iteration = _next++;
        lock.unlock();
        _work(*worker.iteration);
        lock.lock();
    }
    worker.iteration.reset();
    worker.hasEnded = true;
    if (!worker.isGivenUp) _running--;
    if (_running == 0) _ended.notify_all();
}

// On the calling thread.
void HXWorkLoop::workOnNext(std::unique_lock<std::mutex> &lock) {
    const size_t iteration = _next++;
    lock.unlock();
    _work(iteration);
    lock.lock();
}

// Without the lock, which workers need: whoever is told may wait for his terminal.
void HXWorkLoop::tell(std::unique_lock<std::mutex> &lock, const Look &look) const {
    size_t done = _next;
    std::optional<size_t> waitingFor;
    for (const auto &worker : _workers) {
        if (!worker->iteration) continue;
        done--;
        if (!worker->isGivenUp && worker->looksWithoutProgress >= kPatientLooks && !waitingFor)
            waitingFor = worker->iteration;
    }
    lock.unlock();
    look(done, waitingFor);
    lock.lock();
}

void HXWorkLoop::watch(std::unique_lock<std::mutex> &lock, std::chrono::milliseconds pause,
                       const Look &observer) {
    for (;;) {
        while (_running > 0)
            if (_ended.wait_for(lock, pause) == std::cv_status::timeout) {
                for (size_t i = 0; i < _workers.size(); i++)
                    look(*_workers[i], lock);
                if (observer) tell(lock, observer);
            }
        if (_next == _iterations || startWorker(lock)) {
            if (_running == 0) return;
            continue;
        }
        workOnNext(lock); // no thread may be had at all
    }
}

void HXWorkLoop::look(Worker &worker, std::unique_lock<std::mutex> &lock) {
    if (worker.hasEnded || worker.isGivenUp) return;
    if (!worker.iteration || hasProgressed(worker)) {
        worker.looksWithoutProgress = 0;
        return;
    }
    worker.looksWithoutProgress++;
    if (worker.looksWithoutProgress == kPatientLooks && _next < _iterations) startWorker(lock);
    if (worker.looksWithoutProgress < kLooks || !_givesUp) return;
    worker.isGivenUp = true;
    _running--;
    _givenUp.push_back(*worker.iteration);
}

bool HXWorkLoop::hasProgressed(Worker &worker) {
    timespec time{};
    ::clock_gettime(worker.clock, &time);
    const bool isSame = time.tv_sec == worker.lastTime.tv_sec && time.tv_nsec == worker.lastTime.tv_nsec &&
                        *worker.iteration == worker.lastIteration;
    worker.lastTime = time;
    worker.lastIteration = *worker.iteration;
    return !isSame || !isAsleep(worker.statPath);
}
