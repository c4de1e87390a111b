// Result codes of every fallible operation.
//
// A Status is an unsigned 32-bit code; 0 is success. The values are the
// Linux errno numbers of the matching conditions, so a failing system
// call's errno may be returned as a Status unchanged and any non-zero value
// is a failure.
#pragma once

#include <cstdint>
#include <system_error>

#include "lib/util/log.h"

using Status = uint32_t;

constexpr Status STATUS_OK = 0;
constexpr Status STATUS_NOT_FOUND = 2;           // ENOENT
constexpr Status STATUS_NOT_ENOUGH_SPACE = 12;   // ENOMEM
constexpr Status STATUS_NOT_AVAILABLE = 16;      // EBUSY
constexpr Status STATUS_INVALID_PARAMETER = 22;  // EINVAL
constexpr Status STATUS_OUT_OF_RANGE = 34;       // ERANGE
constexpr Status STATUS_NOT_IMPLEMENTED = 38;    // ENOSYS
constexpr Status STATUS_FAILED = 52;             // EBADE
constexpr Status STATUS_OVERFLOW = 75;           // EOVERFLOW
constexpr Status STATUS_INVALID_OPERATION = 95;  // EOPNOTSUPP
constexpr Status STATUS_DISCONNECTED = 107;      // ENOTCONN
constexpr Status STATUS_EXIT = 108;              // ESHUTDOWN
constexpr Status STATUS_TIMEOUT = 110;           // ETIMEDOUT
constexpr Status STATUS_NOTHING_TO_DO = 114;     // EALREADY
constexpr Status STATUS_NOT_READY = 115;         // EINPROGRESS

// The constant's own name ("STATUS_OK", ...), or "<unknown>" for any other
// value. The string is static.
const char* statusName(Status code);

// The status of a failed file-system query: the errno value for a system
// or generic error, STATUS_FAILED for any other category.
Status statusFromError(const std::error_code& error);

// Writes "[<source>:<line>] err_code = <code> (<name>)\n" at error priority,
// formatted only when the threshold admits errors. Does not alter control
// flow; use LOG_STATUS / LOG_STATUS_AT rather than calling it directly.
void reportStatus(std::string_view source, int line, Status code);

// Reports a failed call's status from the current source line.
#define LOG_STATUS(code) ::reportStatus(LOG_SOURCE_PATH, __LINE__, (code))
// Reports it under a fixed line number that scripts match on.
#define LOG_STATUS_AT(line, code) ::reportStatus(LOG_SOURCE_PATH, (line), (code))
