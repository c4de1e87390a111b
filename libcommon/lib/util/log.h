// Process-wide logging.
//
// A log statement is a stream insertion into the calling thread's log
// stream; its buffer (Syslog::SyslogBuf) cuts the text into lines and hands
// each finished line to logEmit, which writes it to syslog, standard output
// or standard error according to the output mode. A statement is formatted
// only when the threshold admits its priority (syslog numbering: a lower
// number is more severe).
//
//   LOGE << "Failed to open " << path;   // error, "<source>:<line> " prefix
//   LOGW << "No update required";        // warning, no prefix
//   LOGI, LOGD                           // info and debug, no prefix
//
// Logging never returns a status and throws only std::length_error or
// std::bad_alloc when a line cannot be stored.
#pragma once

#include <cstdint>
#include <ios>
#include <ostream>
#include <streambuf>
#include <string>
#include <string_view>

constexpr int LOG_PRIORITY_CRITICAL = 2;
constexpr int LOG_PRIORITY_ERROR = 3;
constexpr int LOG_PRIORITY_WARNING = 4;
constexpr int LOG_PRIORITY_INFO = 6;
constexpr int LOG_PRIORITY_DEBUG = 7;

// Output modes for setLogOutput.
constexpr int LOG_OUTPUT_SYSLOG = -1;
constexpr int LOG_OUTPUT_STDOUT = 1;
constexpr int LOG_OUTPUT_STDERR = 2;

namespace Syslog {

// Plain globals: written once at start-up, read without locking.
extern int32_t threshold;   // a statement of priority P is written if threshold >= P
extern int32_t outputMode;  // negative: syslog; 2: stderr; anything else: stdout

// Collects characters into lines; every completed line leaves through one
// logEmit call at the current priority. There is no put area, so every
// character passes through xsputn or overflow.
class SyslogBuf : public std::streambuf {
public:
    SyslogBuf();
    ~SyslogBuf() override;

    void setPriority(int priority) { priority_ = priority; }
    int priority() const { return priority_; }

    // Emits the unfinished line, adding a newline if it lacks one. An empty
    // line emits nothing.
    void flushLine();

protected:
    std::streamsize xsputn(const char* s, std::streamsize n) override;
    int_type overflow(int_type c) override;

private:
    void emitLine();

    int32_t priority_ = LOG_PRIORITY_INFO;
    std::string line_;
};

struct LogStream;

// One log statement: selects the priority on the thread's stream and, when
// destroyed, flushes the line, restores the stream's format flags and
// reports (then clears) a failed stream state at critical priority.
class LogLine {
public:
    explicit LogLine(int priority);
    ~LogLine();
    LogLine(const LogLine&) = delete;
    LogLine& operator=(const LogLine&) = delete;

    std::ostream& stream() { return stream_; }

private:
    LogLine(LogStream& logStream, int priority);

    std::ostream& stream_;
    std::ios_base::fmtflags savedFlags_;
    SyslogBuf& buf_;
};

// "lib/storage/storage_target" for "lib/storage/storage_target.cpp": the
// build hands __FILE__ over relative to the source root.
constexpr std::string_view withoutExtension(std::string_view path) {
    const auto slash = path.rfind('/');
    const auto dot = path.rfind('.');
    if (dot == std::string_view::npos || (slash != std::string_view::npos && dot < slash)) return path;
    return path.substr(0, dot);
}

}  // namespace Syslog

inline bool logEnabled(int priority) { return Syslog::threshold >= priority; }

// Sets the threshold (default 4).
void setLogLevel(int threshold);
// Sets the output mode; mode 1 also makes standard output line-buffered.
void setLogOutput(int mode);
// The one place where log text leaves the process. Adds nothing to the text.
void logEmit(int priority, const char* format, ...) __attribute__((format(printf, 2, 3)));

#define LOG_SOURCE_PATH (::Syslog::withoutExtension(__FILE__))

namespace Syslog {
// Turns a whole insertion chain into a void expression: `&` binds more
// loosely than `<<`, so the chain is complete before it applies.
struct Voidify {
    void operator&(std::ostream&) {}
};
}  // namespace Syslog

// Nothing is formatted unless the threshold admits the priority. An
// expression, so it nests safely under an unbraced if.
#define LOG_STATEMENT(priority) \
    !::logEnabled(priority) ? (void)0 : ::Syslog::Voidify() & ::Syslog::LogLine(priority).stream()

// An error line carrying a fixed line number that scripts match on.
#define LOGE_AT(line) LOG_STATEMENT(LOG_PRIORITY_ERROR) << LOG_SOURCE_PATH << ':' << (line) << ' '
#define LOGE LOGE_AT(__LINE__)
#define LOGW LOG_STATEMENT(LOG_PRIORITY_WARNING)
#define LOGI LOG_STATEMENT(LOG_PRIORITY_INFO)
#define LOGD LOG_STATEMENT(LOG_PRIORITY_DEBUG)
