#include "lib/util/log.h"

#include <syslog.h>
#include <cstdarg>
#include <cstdio>
#include <cstring>

namespace Syslog {

int32_t threshold = LOG_PRIORITY_WARNING;
int32_t outputMode = LOG_OUTPUT_SYSLOG;

// Constructed on the thread's first statement, destroyed at thread exit.
struct LogStream {
    SyslogBuf buf;
    std::ostream stream{&buf};

    LogStream() { stream.setf(std::ios_base::showbase); }
};

namespace {

LogStream& threadLogStream() {
    thread_local LogStream logStream;
    return logStream;
}

void emit(int priority, const char* data, size_t length) { logEmit(priority, "%.*s", static_cast<int>(length), data); }

}  // namespace

SyslogBuf::SyslogBuf() { line_.reserve(80); }

// Nothing written is lost, even a line whose statement never ended.
SyslogBuf::~SyslogBuf() { flushLine(); }

void SyslogBuf::emitLine() {
    emit(priority_, line_.data(), line_.size());
    line_.clear();
}

SyslogBuf::int_type SyslogBuf::overflow(int_type c) {
    if (traits_type::eq_int_type(c, traits_type::eof())) return traits_type::not_eof(c);
    const char ch = traits_type::to_char_type(c);
    line_.push_back(ch);
    if (ch == '\n') emitLine();
    return c;
}

std::streamsize SyslogBuf::xsputn(const char* s, std::streamsize n) {
    const char* rest = s;
    const char* const end = s + n;
    if (!line_.empty()) {
        const char* newline = static_cast<const char*>(std::memchr(rest, '\n', n));
        if (newline == nullptr) {
            line_.append(rest, n);
            return n;
        }
        line_.append(rest, newline + 1 - rest);
        emitLine();
        rest = newline + 1;
    }
    // Whole lines go straight from the caller's characters.
    while (rest < end) {
        const char* newline = static_cast<const char*>(std::memchr(rest, '\n', end - rest));
        if (newline == nullptr) break;
        emit(priority_, rest, newline + 1 - rest);
        rest = newline + 1;
    }
    line_.append(rest, end - rest);
    return n;
}

void SyslogBuf::flushLine() {
    if (line_.empty()) return;
    if (line_.back() != '\n') line_.push_back('\n');
    emitLine();
}

LogLine::LogLine(int priority) : LogLine(threadLogStream(), priority) {}

LogLine::LogLine(LogStream& logStream, int priority)
    : stream_(logStream.stream), savedFlags_(stream_.flags()), buf_(logStream.buf) {
    buf_.setPriority(priority);
}

LogLine::~LogLine() {
    buf_.flushLine();
    stream_.flags(savedFlags_);
    const std::ios_base::iostate state = stream_.rdstate();
    if (state != std::ios_base::goodbit) {
        logEmit(LOG_PRIORITY_CRITICAL, "*-*-*ERROR*-*-* LOG stream has failed: good=%d bad=%d fail=%d eof=%d\n", 0,
                (state & std::ios_base::badbit) != 0, (state & (std::ios_base::badbit | std::ios_base::failbit)) != 0,
                (state & std::ios_base::eofbit) != 0);
        stream_.clear();
    }
}

}  // namespace Syslog

void setLogLevel(int threshold) { Syslog::threshold = threshold; }

void setLogOutput(int mode) {
    Syslog::outputMode = mode;
    if (mode == LOG_OUTPUT_STDOUT) setlinebuf(stdout);
}

void logEmit(int priority, const char* format, ...) {
    va_list args;
    va_start(args, format);
    if (Syslog::outputMode < 0) {
        va_list consoleArgs;
        va_copy(consoleArgs, args);
        vsyslog(priority, format, args);
        // Critical lines reach the console even when syslog is the sink.
        if (priority <= LOG_PRIORITY_CRITICAL) vfprintf(stderr, format, consoleArgs);
        va_end(consoleArgs);
    } else {
        vfprintf(Syslog::outputMode == LOG_OUTPUT_STDERR ? stderr : stdout, format, args);
    }
    va_end(args);
}
