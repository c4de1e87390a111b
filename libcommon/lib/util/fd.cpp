#include "lib/util/fd.h"

#include <unistd.h>
#include <cstring>

#include "lib/util/log.h"

void UniqueFd::reset(int fd) {
    if (fd_ >= 0) (void)::close(fd_);  // nothing useful can be done about a failed close
    fd_ = fd;
}

void logOpenFailure(const char* path, int error) { LOGE << "Failed to open " << path << ": " << std::strerror(error); }
