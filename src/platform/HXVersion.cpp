#include "platform/HXVersion.h"

const char *const kHXVersion = HEFT_VERSION;
