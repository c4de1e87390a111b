// Points standard error at /dev/null for the guard's lifetime. Building the
// registry off the device writes two lines there on every run (the
// partitioning tool's complaint about the missing flash device and the
// boot-vector error line): the writes still happen, only not to the
// terminal that shows the results.
#pragma once

namespace bench {

class QuietStderr {
public:
    QuietStderr();
    ~QuietStderr();
    QuietStderr(const QuietStderr&) = delete;
    QuietStderr& operator=(const QuietStderr&) = delete;

private:
    int saved_;  // the original standard error, -1 when it could not be kept
};

}  // namespace bench
