#include "storage_log.h"

#include <regex>
#include <vector>

namespace testing_support {

std::string withoutStorageLineNumbers(const std::string& text) {
    static const std::regex prefix(R"(lib/storage/storage_target:[0-9]+ )");
    static const std::regex report(R"(\[lib/storage/storage_target:[0-9]+\] )");
    static const std::regex openFailure(R"(libcommon/lib/util/fd:[0-9]+ Failed to open )");
    std::string out = std::regex_replace(text, prefix, "lib/storage/storage_target:N ");
    out = std::regex_replace(out, report, "[lib/storage/storage_target:N] ");
    return std::regex_replace(out, openFailure, "libcommon/lib/util/fd:N Failed to open ");
}

std::string normalisedStorageLog(const std::string& text) {
    static const std::regex temporary(R"(/tmp/firmware[A-Za-z0-9]{6})");
    const std::string out = withoutStorageLineNumbers(text);
    std::vector<std::string> names;
    std::string result;
    auto last = out.cbegin();
    for (std::sregex_iterator it(out.begin(), out.end(), temporary), end; it != end; ++it) {
        const std::string name = it->str();
        size_t number = 0;
        while (number < names.size() && names[number] != name) ++number;
        if (number == names.size()) names.push_back(name);
        result.append(last, out.cbegin() + it->position());
        result += "#" + std::to_string(number + 1);
        last = out.cbegin() + it->position() + it->length();
    }
    result.append(last, out.cend());
    return result;
}

}  // namespace testing_support
