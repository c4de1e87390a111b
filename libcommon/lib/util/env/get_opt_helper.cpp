#include "lib/util/env/get_opt_helper.h"

#include <algorithm>
#include <cctype>
#include <climits>
#include <sstream>
#include <stdexcept>
#include <string_view>

#include "lib/util/log.h"

namespace {

// isprint is undefined beyond unsigned char, and ids go far above it.
bool isShortId(int id) { return id >= 0 && id <= UCHAR_MAX && std::isprint(id); }

bool hasLongName(const GetOptHelper::OptionSpec& row) { return row.name != nullptr && row.name[0] != '\0'; }

bool isRegistered(GetOptHelper::OptionKind kind) {
    return kind == GetOptHelper::OptionKind::Plain || kind == GetOptHelper::OptionKind::Choice ||
           kind == GetOptHelper::OptionKind::Flag;
}

bool isBlank(char c) { return std::isblank(static_cast<unsigned char>(c)); }

std::vector<GetOptHelper::OptionSpec> copyTable(const GetOptHelper::OptionSpec* rows, size_t count) {
    std::vector<GetOptHelper::OptionSpec> table;
    // Checked before rows + count is formed, which would overflow first.
    if (count > table.max_size()) throw std::length_error("cannot create std::vector larger than max_size()");
    table.assign(rows, rows + count);
    return table;
}

}  // namespace

GetOptHelper::GetOptHelper(const OptionSpec* rows, size_t count) : options(copyTable(rows, count)) {
    longOptions.reserve(count + 1);
    shortOptions.reserve(2 * count + 1);
    for (const OptionSpec& row : options) {
        if (!isRegistered(row.kind)) continue;
        // Flag rows are stored by parse, not by getopt_long, so its flag
        // member stays null.
        if (hasLongName(row)) longOptions.push_back({row.name, row.hasArg, nullptr, row.id});
        if (isShortId(row.id)) {
            shortOptions.push_back(static_cast<char>(row.id));
            if (row.hasArg != 0) shortOptions.push_back(':');
        }
    }
    longOptions.push_back({nullptr, 0, nullptr, 0});
}

GetOptHelper::~GetOptHelper() = default;

const GetOptHelper::OptionSpec* GetOptHelper::findRow(int id) const {
    for (const OptionSpec& row : options) {
        if (row.id == id) return &row;
    }
    return nullptr;
}

Status GetOptHelper::parse(int argc, char** argv) {
    for (;;) {
        const int ch = getopt_long(argc, argv, shortOptions.c_str(), longOptions.data(), nullptr);
        const OptionSpec* row = findRow(ch);
        if (row != nullptr && row->kind == OptionKind::Choice) {
            if (optarg == nullptr) throw std::logic_error("choice option without an argument");
            const auto value = row->values.find(optarg);
            const Status r =
                value != row->values.end() ? handleChoice(ch, optarg, value->second) : invalidChoice(ch, optarg);
            if (r != STATUS_OK) return r;
            continue;
        }
        if (row != nullptr && row->kind == OptionKind::Flag) {
            if (row->flag != nullptr) *row->flag = 1;
            continue;
        }
        if (row != nullptr && row->kind != OptionKind::Plain) continue;
        // Plain rows, '?' from getopt_long's own error reports, and -1.
        const Status r = handleOption(ch, optarg);
        if (r != STATUS_OK) return r;
        if (ch < 0) break;
    }
    return finish(argv + optind, argc - optind);
}

Status GetOptHelper::handleChoice(int, const char*, int) { return STATUS_NOT_IMPLEMENTED; }

Status GetOptHelper::invalidChoice(int id, const char* arg) {
    const OptionSpec* row = findRow(id);
    if (row != nullptr && hasLongName(*row)) {
        LOGE << "Invalid value for --" << row->name << ": '" << arg << "'";
    } else {
        LOGE << "Invalid value for -" << id << ": '" << arg << "'";
    }
    return STATUS_INVALID_PARAMETER;
}

const GetOptHelper::OptionSpec* GetOptHelper::optFor(char c) const {
    const OptionSpec* row = findRow(static_cast<unsigned char>(c));
    if (row == nullptr) LOGE << "Unable to find optFor '" << c << "'";
    return row;
}

std::string GetOptHelper::usageText(unsigned helpColumn, unsigned width) const {
    std::ostringstream out;
    for (const OptionSpec& row : options) {
        if (row.kind == OptionKind::Text) {
            if (row.help != nullptr) out << row.help;
            continue;
        }
        if (!isRegistered(row.kind)) continue;

        unsigned col = 0;
        const bool shortId = isShortId(row.id);
        if (hasLongName(row)) {
            const unsigned nameLength = static_cast<unsigned>(std::char_traits<char>::length(row.name));
            if (shortId) {
                out << "  -" << static_cast<char>(row.id) << ", --" << row.name;
                col = 8 + nameLength;
            } else {
                out << "  --" << row.name;
                col = 4 + nameLength;
            }
            if (row.hasArg != 0) {
                out << "=arg";
                col += 4;
            }
        } else if (shortId) {
            out << "  -" << static_cast<char>(row.id);
            col = 4;
            if (row.hasArg != 0) {
                out << " arg";
                col = 8;
            }
        }

        writeWrapped(out, row.help, col, helpColumn, width);

        if (row.defaultValue != nullptr && row.defaultValue[0] != '\0') {
            out << std::string(helpColumn, ' ') << "default: " << row.defaultValue << '\n';
        }
    }
    return out.str();
}

void GetOptHelper::writeWrapped(std::ostream& out, const char* text, unsigned col, unsigned helpColumn,
                                unsigned width) {
    // An option part that reaches into the help column pushes the help onto
    // its own line.
    if (col + 1 >= helpColumn) {
        out << '\n';
        col = 0;
    }
    const std::string_view help = text != nullptr ? std::string_view(text) : std::string_view();
    size_t pos = 0;
    while (pos < help.size()) {
        if (col < helpColumn) out << std::string(helpColumn - col, ' ');
        const size_t avail = width - (std::max(col, helpColumn) + 1);
        const size_t rest = help.size() - pos;
        size_t piece = rest;
        // Deliberately strict: a text exactly avail long still breaks at its
        // last blank.
        if (!(rest < avail)) {
            piece = avail;
            for (size_t p = avail; p >= 1; --p) {
                if (p < rest && isBlank(help[pos + p])) {
                    piece = p;
                    break;
                }
            }
        }
        out << help.substr(pos, piece);
        pos += piece;
        while (pos < help.size() && isBlank(help[pos])) ++pos;
        if (pos < help.size()) {
            out << '\n';
            col = 0;
        }
    }
    out << '\n';
}
