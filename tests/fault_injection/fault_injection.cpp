#include "fault_injection.h"

#include <cstdlib>
#include <stdexcept>

#include "files.h"

namespace testing_support {

const char* faultInjectionLibrary() { return FAULT_INJECTION_LIBRARY; }

Environment preloadEnv() {
    const char* inherited = std::getenv("ASAN_OPTIONS");
    std::string asanOptions = inherited != nullptr ? inherited : "";
    if (!asanOptions.empty()) asanOptions += ':';
    asanOptions += "verify_asan_link_order=0";
    return {{"LD_PRELOAD", faultInjectionLibrary()}, {"ASAN_OPTIONS", asanOptions}};
}

Environment locksOffEnv() {
    Environment env = preloadEnv();
    env["FAULT_LOCKS"] = "off";
    return env;
}

Environment faultEnv(const std::string& call, unsigned long nth, const std::string& action,
                     const std::string& pathSubstr, const std::string& countFile) {
    Environment env = faultCountEnv(call, countFile, pathSubstr);
    env["FAULT_NTH"] = std::to_string(nth);
    env["FAULT_ACTION"] = action;
    return env;
}

Environment faultFromEnv(const std::string& call, unsigned long nth, const std::string& action,
                         const std::string& pathSubstr, const std::string& countFile) {
    Environment env = faultEnv(call, nth, action, pathSubstr, countFile);
    env["FAULT_NTH"] += "+";
    return env;
}

Environment faultCountEnv(const std::string& call, const std::string& countFile, const std::string& pathSubstr) {
    Environment env = preloadEnv();
    env["FAULT_CALL"] = call;
    if (!pathSubstr.empty()) env["FAULT_PATH_SUBSTR"] = pathSubstr;
    if (!countFile.empty()) env["FAULT_COUNT_FILE"] = countFile;
    return env;
}

Environment recordEnv(const std::string& recordFile, const std::string& pathSubstr, std::optional<int64_t> fakeTime,
                      Environment base) {
    const auto filter = base.find("FAULT_PATH_SUBSTR");
    if (filter != base.end() && filter->second != pathSubstr) {
        throw std::invalid_argument("recordEnv: the base environment filters on " + filter->second + ", not on " +
                                    pathSubstr);
    }
    if (!pathSubstr.empty()) base["FAULT_PATH_SUBSTR"] = pathSubstr;
    if (!recordFile.empty()) base["FAULT_RECORD"] = recordFile;
    if (fakeTime) base["FAULT_MTIME"] = std::to_string(*fakeTime);
    return base;
}

unsigned long readFaultCount(const std::filesystem::path& countFile) {
    const std::string text = readText(countFile);
    const bool wellFormed = text.size() >= 2 && text.size() <= 21 && text.back() == '\n' &&
                            text.find_first_not_of("0123456789") == text.size() - 1;
    if (!wellFormed) throw std::runtime_error("malformed count file " + countFile.string() + ": " + text);
    return std::stoul(text);
}

}  // namespace testing_support
