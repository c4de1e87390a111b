#include "lib/util/status.h"

const char* statusName(Status code) {
    switch (code) {
        case STATUS_OK:
            return "STATUS_OK";
        case STATUS_NOT_FOUND:
            return "STATUS_NOT_FOUND";
        case STATUS_NOT_ENOUGH_SPACE:
            return "STATUS_NOT_ENOUGH_SPACE";
        case STATUS_NOT_AVAILABLE:
            return "STATUS_NOT_AVAILABLE";
        case STATUS_INVALID_PARAMETER:
            return "STATUS_INVALID_PARAMETER";
        case STATUS_OUT_OF_RANGE:
            return "STATUS_OUT_OF_RANGE";
        case STATUS_NOT_IMPLEMENTED:
            return "STATUS_NOT_IMPLEMENTED";
        case STATUS_FAILED:
            return "STATUS_FAILED";
        case STATUS_OVERFLOW:
            return "STATUS_OVERFLOW";
        case STATUS_INVALID_OPERATION:
            return "STATUS_INVALID_OPERATION";
        case STATUS_DISCONNECTED:
            return "STATUS_DISCONNECTED";
        case STATUS_EXIT:
            return "STATUS_EXIT";
        case STATUS_TIMEOUT:
            return "STATUS_TIMEOUT";
        case STATUS_NOTHING_TO_DO:
            return "STATUS_NOTHING_TO_DO";
        case STATUS_NOT_READY:
            return "STATUS_NOT_READY";
    }
    return "<unknown>";
}

Status statusFromError(const std::error_code& error) {
    if (error.category() == std::system_category() || error.category() == std::generic_category()) {
        return static_cast<Status>(error.value());
    }
    return STATUS_FAILED;
}

void reportStatus(std::string_view source, int line, Status code) {
    if (!logEnabled(LOG_PRIORITY_ERROR)) return;
    logEmit(LOG_PRIORITY_ERROR, "[%.*s:%d] err_code = %u (%s)\n", static_cast<int>(source.size()), source.data(), line,
            code, statusName(code));
}
