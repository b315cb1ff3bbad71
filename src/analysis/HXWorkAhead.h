// Work that is needed item by item and that others may do ahead of whoever needs it.
#pragma once

#include <atomic>
#include <cstddef>
#include <functional>
#include <utility>
#include <vector>

// Each item is done once. Any thread; none waits for one that has not begun the item, so that whoever needs
// the items gets on alone as well.
class HXWorkAhead {
  public:
    // `work` is called with numbers below `count`.
    HXWorkAhead(size_t count, std::function<void(size_t)> work) : _work(std::move(work)), _states(count) {}

    // Does the items that nobody has begun, in ascending order.
    void help() {
        for (size_t item = _next++; item < _states.size(); item = _next++)
            if (begin(item)) finish(item);
    }
    // Returns when the item is done; does it if nobody has begun it.
    void need(size_t item) {
        if (begin(item)) return finish(item);
        while (_states[item].load(std::memory_order_acquire) != done)
            _states[item].wait(begun, std::memory_order_acquire);
    }

  private:
    enum State : int { untouched, begun, done };

    bool begin(size_t item) {
        int expected = untouched;
        return _states[item].compare_exchange_strong(expected, begun, std::memory_order_acq_rel);
    }
    void finish(size_t item) {
        _work(item);
        _states[item].store(done, std::memory_order_release);
        _states[item].notify_all();
    }

    const std::function<void(size_t)> _work;
    std::vector<std::atomic<int>> _states;
    std::atomic<size_t> _next = 0;
};
