// The version of the programs, which the build knows.
#pragma once

// "1.0.0". All programs of a build have the same.
extern const char *const kHXVersion;
