#pragma once

#include <optional>
#include <string>
#include <utility>

// A failure of the command line, of target selection or of loading a memory graph.
struct HXError {
    std::string domain;
    int code = 0;
    std::optional<std::string> localizedDescription; // what the driver prints; none: nothing to print

    HXError() = default;
    HXError(std::string errorDomain, int errorCode, std::optional<std::string> description = std::nullopt)
        : domain(std::move(errorDomain)), code(errorCode), localizedDescription(std::move(description)) {}
};

inline constexpr char HXHeftError[] = "HXHeftError";             // options and targets
inline constexpr char HXHeftErrorDomain[] = "HeftErrorDomain";   // memory graphs
inline constexpr char HXPOSIXErrorDomain[] = "POSIXErrorDomain"; // a file that cannot be read: code is errno
