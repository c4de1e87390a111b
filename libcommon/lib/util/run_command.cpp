#include "lib/util/run_command.h"

#include <cstdio>

Status runCommand(const char* command, std::string& output, bool ignoreStatus) {
    FILE* stream = popen(command, "re");
    if (stream == nullptr) return STATUS_FAILED;

    output.clear();
    char buffer[256];
    while (!feof(stream)) {
        if (fgets(buffer, sizeof buffer, stream) != nullptr) output += buffer;
    }
    const int status = pclose(stream);

    if (ignoreStatus) return STATUS_OK;
    // pclose's -1 sets these bits too and so counts as a failed command.
    if ((status & 0xff00) != 0) return STATUS_FAILED;
    // A signal is told apart from a failure on purpose.
    if (status < 0 || (status & 0x7f) != 0) return STATUS_NOT_FOUND;
    return STATUS_OK;
}

Status runCommand(const std::string& command, std::string& output) {
    return runCommand(command.c_str(), output, false);
}
