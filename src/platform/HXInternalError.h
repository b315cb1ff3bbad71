// Broken preconditions: errors of the program itself, which no input reaches.
#pragma once

// Prints the operation and the condition to standard error and aborts.
[[noreturn]] void HXInternalError(const char *operation, const char *condition);

// Stops the program unless `holds`.
inline void HXRequire(bool holds, const char *operation, const char *condition) {
    if (!holds) [[unlikely]]
        HXInternalError(operation, condition);
}
