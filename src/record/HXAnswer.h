// Asking a process that may not answer.
#pragma once

#include "platform/HXServices.h"

// Calls `ask` on a thread of its own; false when it was given up (HXServices::dispatch_apply). What it
// touches it owns.
inline bool HXIsAnswered(HXServices &services, std::function<void()> ask) {
    const HXDispatchQueue queue = services.dispatch_queue_create("org.heft.record", QOS_CLASS_UTILITY);
    return services.dispatch_apply(1, queue, [ask = std::move(ask)](size_t) { ask(); }).empty();
}
inline constexpr char kNotAnswering[] = "not answering";
