// Work queues.
#include "platform/linux/HXLinuxServices.h"
#include "platform/linux/HXStandardOutput.h"
#include "platform/linux/HXWorkLoop.h"

#include <sched.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>
#include <numeric>
#include <optional>

namespace {

// How many processors the calling thread may run on.
size_t usableProcessorCount() {
    // Machines with more processors than a cpu_set_t has bits need larger sets.
    for (size_t processors = CPU_SETSIZE; processors <= (size_t{1} << 20); processors *= 4) {
        cpu_set_t *set = CPU_ALLOC(processors);
        if (set == nullptr) break;
        const size_t bytes = CPU_ALLOC_SIZE(processors);
        const bool known = ::sched_getaffinity(0, bytes, set) == 0;
        const int error = errno;
        const int count = known ? CPU_COUNT_S(bytes, set) : 0;
        CPU_FREE(set);
        if (known) return static_cast<size_t>(std::max(count, 1));
        if (error != EINVAL) break;
    }
    return 1;
}

// In which the iterations are started.
std::vector<size_t> orderOf(size_t iterations, const HXDispatchQueue &queue) {
    std::vector<size_t> order(iterations);
    std::iota(order.begin(), order.end(), size_t{0});
    if (!queue.costOf) return order;
    std::vector<uint64_t> costs;
    for (size_t i = 0; i < iterations; i++)
        costs.push_back(queue.costOf(i));
    std::stable_sort(order.begin(), order.end(), [&](size_t a, size_t b) { return costs[a] > costs[b]; });
    return order;
}

} // namespace

HXDispatchQueue HXLinuxServices::dispatch_queue_create(const std::string &label, uint32_t qualityOfService) {
    return {label, qualityOfService};
}

std::vector<size_t> HXLinuxServices::dispatch_apply(size_t iterations, const HXDispatchQueue &queue,
                                                    std::function<void(size_t)> work) {
    const size_t workers = _workerCount == 0 ? usableProcessorCount() : _workerCount;
    const auto order = std::make_shared<const std::vector<size_t>>(orderOf(iterations, queue));
    HXWorkLoop::Look look;
    if (_observer != nullptr && !queue.activity.empty())
        look = [&](size_t done, std::optional<size_t> waitingFor) {
            if (waitingFor) waitingFor = (*order)[*waitingFor];
            _observer->looked(queue, done, iterations, waitingFor);
        };
    auto givenUp = HXWorkLoop::run(
        iterations, workers, queue.isOwnWork ? std::nullopt : std::optional(_answerTime),
        [order, work = std::move(work)](size_t place) { work((*order)[place]); }, look);
    for (size_t &iteration : givenUp)
        iteration = (*order)[iteration];
    std::sort(givenUp.begin(), givenUp.end());
    if (look) _observer->ended();
    if (!givenUp.empty()) _hasGivenUp = true;
    return givenUp;
}

int HXLinuxServices::finish(const char *program, int status) {
    const int failure = HXFlushStandardOutput();
    if (failure != 0 && failure != EPIPE) {
        std::fprintf(stderr, "%s: standard output: %s\n", program, std::strerror(failure));
        status = 1;
    }
    if (!_hasGivenUp) return status;
    ::_exit(status);
}
