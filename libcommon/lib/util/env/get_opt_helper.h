// Table-driven command-line parsing on top of getopt_long.
//
// A subclass hands its option table to the constructor and implements the
// handlers; parse() runs getopt_long over argc/argv and dispatches every
// option it returns, in command-line order:
//   Plain  -> handleOption(id, optarg)
//   Choice -> handleChoice(id, optarg, value) when optarg is one of the
//             row's words, else invalidChoice(id, optarg)
//   Flag   -> stores 1 through the row's flag (when not null); no handler
//   Text   -> not an option: its help is copied into the usage text as is
// Any value getopt_long returns that no row claims ('?' for an unknown
// option or a missing argument, after getopt_long has printed its own
// message to stderr) goes to handleOption too; at the end handleOption is
// called once with -1, then finish with the remaining, non-option arguments.
// The first non-zero Status of any handler ends the parse and is returned.
//
// The helper never prints to stdout and never exits: usage output and exit
// codes belong to the subclass. It uses getopt's process-global optind and
// optarg and never resets optind, so there is one parse per process.
#pragma once

#include <getopt.h>

#include <cstddef>
#include <cstdint>
#include <map>
#include <ostream>
#include <string>
#include <vector>

#include "lib/util/status.h"

class GetOptHelper {
public:
    enum class OptionKind : int32_t {
        Plain = 0,
        Text = 1,
        Choice = 2,
        Flag = 3,
        // Any other value: neither registered with getopt nor shown.
    };

    // One row of an option table. The strings are not copied: they must
    // outlive the helper.
    struct OptionSpec {
        // Returned by getopt_long; a printable character is also the short
        // option letter, anything else (1000 and up, say) is long-only.
        int32_t id;
        // Long name without "--"; null or empty for none.
        const char* name;
        // Shown as "default: <value>" in the usage; "" for none. Never
        // applied by the helper (a subclass reads it through optFor).
        const char* defaultValue;
        // getopt_long's has_arg: 0 none, 1 required, 2 optional.
        int32_t hasArg;
        // Help text; for a Text row, the literal text to print.
        const char* help;
        OptionKind kind;
        // Choice only: allowed words (exact, case-sensitive) and their values.
        std::map<std::string, int32_t> values;
        // Flag only: set to 1 when the option is seen; may be null.
        uint8_t* flag;
    };

    // Copies the table (values maps included) and builds shortOptions and
    // longOptions. Throws std::length_error ("cannot create std::vector
    // larger than max_size()") when count cannot be held.
    GetOptHelper(const OptionSpec* rows, size_t count);
    virtual ~GetOptHelper();

    GetOptHelper(const GetOptHelper&) = delete;
    GetOptHelper& operator=(const GetOptHelper&) = delete;

    // Returns the first non-zero Status of a handler, else finish's Status.
    // Throws std::logic_error when a Choice row gets no argument (a Choice
    // row must have hasArg 1).
    [[nodiscard]] Status parse(int argc, char** argv);

    // The option list: one entry per Plain, Choice and Flag row in table
    // order, the help wrapped at helpColumn within width, each followed by a
    // "default: " line when the row has a default; Text rows verbatim.
    // Requires width > helpColumn + 1.
    std::string usageText(unsigned helpColumn, unsigned width) const;

    // The first row whose id is c taken as unsigned (so ids above 255 are
    // never found). Logs an error and returns null when there is none. The
    // row lives as long as the helper.
    const OptionSpec* optFor(char c) const;

protected:
    virtual Status handleOption(int id, const char* arg) = 0;
    virtual Status finish(char** rest, int count) = 0;
    // Default: STATUS_NOT_IMPLEMENTED.
    virtual Status handleChoice(int id, const char* arg, int value);
    // Default: logs "Invalid value for --<name>: '<arg>'" (or
    // "-<id in decimal>" without a long name) at error priority and returns
    // STATUS_INVALID_PARAMETER.
    virtual Status invalidChoice(int id, const char* arg);

    std::vector<OptionSpec> options;
    std::vector<struct option> longOptions;  // ends with an all-zero entry
    std::string shortOptions;

private:
    const OptionSpec* findRow(int id) const;
    static void writeWrapped(std::ostream& out, const char* text, unsigned col, unsigned helpColumn, unsigned width);
};
