#include "log_in_child.h"

#include "lib/util/log.h"

namespace testing_support {

ProcessResult logInChild(int output, int threshold, const std::function<void()>& body) {
    return runInChild([&] {
        setLogOutput(output);
        setLogLevel(threshold);
        body();
        return 0;
    });
}

}  // namespace testing_support
