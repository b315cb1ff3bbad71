#include "platform/HXInternalError.h"

#include <cstdio>
#include <cstdlib>

void HXInternalError(const char *operation, const char *condition) {
    std::fprintf(stderr, "heft: internal error in %s: %s\n", operation, condition);
    std::abort();
}
