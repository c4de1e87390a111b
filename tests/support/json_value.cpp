#include "json_value.h"

#include <cstdlib>
#include <stdexcept>

namespace testing_support {
namespace {

class Parser {
public:
    explicit Parser(const std::string& text) : text_(text) {}

    JsonValue document() {
        JsonValue value = parseValue();
        skipSpace();
        if (at_ != text_.size()) fail("text after the document");
        return value;
    }

private:
    [[noreturn]] void fail(const std::string& what) const {
        throw std::invalid_argument("JSON: " + what + " at offset " + std::to_string(at_));
    }

    void skipSpace() {
        while (at_ < text_.size() &&
               (text_[at_] == ' ' || text_[at_] == '\n' || text_[at_] == '\t' || text_[at_] == '\r')) {
            ++at_;
        }
    }

    bool take(const std::string& word) {
        if (text_.compare(at_, word.size(), word) != 0) return false;
        at_ += word.size();
        return true;
    }

    void expect(char c) {
        skipSpace();
        if (at_ >= text_.size() || text_[at_] != c) fail(std::string("expected '") + c + "'");
        ++at_;
    }

    JsonValue parseValue() {
        skipSpace();
        if (at_ >= text_.size()) fail("unexpected end");
        JsonValue value;
        const char c = text_[at_];
        if (c == '{') return parseObject();
        if (c == '[') return parseArray();
        if (c == '"') {
            value.type = JsonValue::Type::kString;
            value.text = parseString();
        } else if (take("true")) {
            value.type = JsonValue::Type::kBool;
            value.boolean = true;
        } else if (take("false")) {
            value.type = JsonValue::Type::kBool;
        } else if (take("null")) {
            value.type = JsonValue::Type::kNull;
        } else if (c == '-' || (c >= '0' && c <= '9')) {
            const char* start = text_.c_str() + at_;
            char* end = nullptr;
            value.type = JsonValue::Type::kNumber;
            value.number = std::strtod(start, &end);
            at_ += static_cast<size_t>(end - start);
        } else {
            fail("unexpected character");
        }
        return value;
    }

    JsonValue parseObject() {
        JsonValue value;
        value.type = JsonValue::Type::kObject;
        parseElements('{', '}', [&] {
            skipSpace();
            if (at_ >= text_.size() || text_[at_] != '"') fail("expected a member name");
            const std::string name = parseString();
            expect(':');
            if (!value.members.emplace(name, parseValue()).second) fail("repeated member " + name);
        });
        return value;
    }

    JsonValue parseArray() {
        JsonValue value;
        value.type = JsonValue::Type::kArray;
        parseElements('[', ']', [&] { value.items.push_back(parseValue()); });
        return value;
    }

    // The comma-separated elements between `open` and `close`, each read by
    // `parseElement`.
    template <typename ParseElement>
    void parseElements(char open, char close, ParseElement parseElement) {
        expect(open);
        skipSpace();
        const std::string end(1, close);
        if (take(end)) return;
        for (;;) {
            parseElement();
            skipSpace();
            if (take(end)) return;
            expect(',');
        }
    }

    std::string parseString() {
        ++at_;  // the opening quote
        std::string result;
        for (;;) {
            if (at_ >= text_.size()) fail("unterminated string");
            const char c = text_[at_++];
            if (c == '"') return result;
            if (static_cast<unsigned char>(c) < 0x20) fail("raw control character in a string");
            if (c != '\\') {
                result += c;
                continue;
            }
            if (at_ >= text_.size()) fail("unterminated escape");
            const char e = text_[at_++];
            switch (e) {
                case '"':
                case '\\':
                case '/':
                    result += e;
                    break;
                case 'b':
                    result += '\b';
                    break;
                case 'f':
                    result += '\f';
                    break;
                case 'n':
                    result += '\n';
                    break;
                case 'r':
                    result += '\r';
                    break;
                case 't':
                    result += '\t';
                    break;
                case 'u': {
                    if (at_ + 4 > text_.size()) fail("short \\u escape");
                    const unsigned code = static_cast<unsigned>(std::stoul(text_.substr(at_, 4), nullptr, 16));
                    at_ += 4;
                    if (code >= 0x80) fail("\\u escape beyond ASCII");  // the programs tested never write one
                    result += static_cast<char>(code);
                    break;
                }
                default:
                    fail("unknown escape");
            }
        }
    }

    const std::string& text_;
    size_t at_ = 0;
};

}  // namespace

JsonValue parseJson(const std::string& text) { return Parser(text).document(); }

}  // namespace testing_support
