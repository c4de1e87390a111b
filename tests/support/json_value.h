// A strict reader of JSON documents, for tests that check a program's JSON
// output by its structure rather than its spelling.
#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

namespace testing_support {

struct JsonValue {
    enum class Type { kNull, kBool, kNumber, kString, kArray, kObject };
    Type type = Type::kNull;
    bool boolean = false;
    double number = 0;
    std::string text;
    std::vector<JsonValue> items;
    std::map<std::string, JsonValue> members;

    bool isNull() const { return type == Type::kNull; }
    // The member `name` of an object; throws std::out_of_range when absent.
    const JsonValue& operator[](const std::string& name) const { return members.at(name); }
    // The element `index` of an array; throws std::out_of_range.
    const JsonValue& operator[](size_t index) const { return items.at(index); }
};

// Parses one whole document (surrounding white space allowed); throws
// std::invalid_argument, naming the offset, for anything that is not JSON.
JsonValue parseJson(const std::string& text);

}  // namespace testing_support
