/*
 * LD_PRELOAD shim that fails or ends the process at the Nth matching file
 * system call, so tests can reach failure paths and simulate power cuts
 * without any test code in the product, and that records what the calls
 * changed. Configured by environment variables, read once; without any of
 * them it only forwards.
 *
 *   FAULT_CALL         what to count: a call family, an exact function name,
 *                      or "mutating".
 *                        open      open, openat, creat, fopen, and
 *                                  openat2 through syscall(), read-only
 *                                  or not
 *                        write     write, writev
 *                        pwrite    pwrite, pwritev
 *                        copy      sendfile, copy_file_range
 *                        rename    rename, renameat, renameat2
 *                        unlink    unlink, unlinkat, remove, rmdir
 *                        truncate  ftruncate, truncate
 *                        utimens   utimensat, futimens
 *                        sync      syncfs, fsync, fdatasync
 *                        mkdir     mkdir, mkdirat
 *                        chmod     chmod, fchmod, fchmodat
 *                        read      read, pread: a card that cannot read
 *                                  a file's blocks
 *                        mutating  every call above except opens that
 *                                  neither write, create nor truncate
 *                      A family name wins over the function of the same
 *                      name. The 64-bit and fortified variants (open64,
 *                      __open_2, pwrite64, ...) count as their base name.
 *   FAULT_NTH          1-based number of the one matching call to act on;
 *                      later calls are made normally. "N+" acts on the Nth
 *                      and on every later one. Without it calls are only
 *                      counted.
 *   FAULT_ACTION       required with FAULT_NTH:
 *                        errno:NAME or errno:NUMBER  the call is not made
 *                          and fails with that errno (NULL for fopen)
 *                        crash  the call is not made and the process is
 *                          killed with SIGKILL: no exit handlers, no stdio
 *                          flushing
 *                        short:BYTES  write and pwrite transfer at most
 *                          BYTES; any other call is made unchanged
 *                        stop  the process stops itself with SIGSTOP
 *                          before the call, and makes it once continued:
 *                          a test changes what lies under the file system
 *                          (the device's table, say) at an exact call
 *   FAULT_PATH_SUBSTR  only calls whose file's path contains this text are
 *                      counted, recorded and given the fake time. Path
 *                      arguments are matched as given (a relative path
 *                      after an *at call's directory is also matched joined
 *                      to that directory's path); a call that takes only a
 *                      descriptor is matched on the path the kernel shows
 *                      for it in /proc/self/fd. rename matches on either
 *                      name.
 *   FAULT_COUNT_FILE   receives the number of matching calls seen, in
 *                      decimal with a newline: 0 at load, then rewritten
 *                      after every matching call (before a crash too), so
 *                      it is right however the process ends. Give an
 *                      absolute path.
 *   FAULT_RECORD       absolute path of a record that gets one line
 *                      appended, with one write, after every successful
 *                      call above that changed something: opens that
 *                      created or truncated a file, writes to regular
 *                      files, and every other call but the reading opens.
 *                      syncfs passes any FAULT_PATH_SUBSTR. A call the
 *                      shim fails or crashes on is not made, so not
 *                      recorded. Fields are separated by one space; PATH
 *                      is absolute (relative names joined to the working
 *                      or the *at directory, descriptors named by
 *                      /proc/self/fd) with '%', ' ' and '\n' written %25,
 *                      %20, %0A; INO is the inode; MTIME the file's
 *                      modification time after the call, SEC.NNNNNNNNN;
 *                      HEX the bytes written, "-" for none.
 *                        create PATH INO MTIME       a new regular file
 *                        truncate PATH INO SIZE MTIME
 *                        write PATH INO OFFSET HEX MTIME
 *                                                    regular files only;
 *                          OFFSET is where the bytes went (the end for
 *                          O_APPEND); sendfile and copy_file_range are
 *                          writes of the bytes read back from the
 *                          destination, else the source, else HEX is "?"
 *                        unlink PATH INO
 *                        rmdir PATH
 *                        mkdir PATH
 *                        rename FROM TO INO REPLACED  REPLACED is the inode
 *                                                    TO named before, or 0
 *                        utimens PATH INO MTIME
 *                        fsync PATH INO              fsync and fdatasync
 *                        syncfs
 *                        chmod PATH INO
 *                      Writes through stdio streams are made inside glibc
 *                      and are not seen. Works without FAULT_CALL.
 *   FAULT_MTIME        SECONDS, a fake clock, optionally negative: right
 *                      after a successful call creates, truncates or
 *                      writes a regular file, its modification and access
 *                      times are set to SECONDS.000000000 (before the call
 *                      is recorded). The program's own utimensat and
 *                      futimens are left as they are. Works without
 *                      FAULT_CALL.
 *   FAULT_WRITE_ERRORS "ignore": a write, pwrite, writev, pwritev, fsync,
 *                      fdatasync or syncfs that fails (in the kernel or
 *                      through FAULT_ACTION) returns success instead, a
 *                      write as though it wrote every byte: a store that
 *                      ignores its device's failures, which a test must
 *                      catch. Works without FAULT_CALL.
 *   FAULT_LOCKS        "off": flock takes and drops no lock and returns 0,
 *                      so every lock is granted at once and nobody is kept
 *                      out; how a test shows what the locks prevent. Works
 *                      without FAULT_CALL.
 *
 * Files whose names end in ".gcda" are gcov's counts, which a coverage
 * build opens as it exits (and writes through stdio): calls that name such
 * a file are passed through, never counted, failed, recorded or given the
 * fake time, so that counts stay those of the program under test.
 *
 * The shim acts only in the process that loaded it: it removes the FAULT_*
 * variables from the environment at load, so programs that process starts
 * run unaffected, and a forked child passes every call through. A bad
 * setting ends the process at load with status 98 and a message on
 * standard error, and so does a record line that cannot be written later.
 *
 * The shim neither allocates (record lines are built in anonymous mappings)
 * nor uses stdio, and its own I/O goes through raw system calls
 * (raw_syscall.h, never through the syscall() it interposes): it may run
 * inside the start-up of any process, before the program's allocator or its
 * sanitizer runtime is ready, and its own calls are never counted or
 * recorded.
 */
#define _GNU_SOURCE
#undef _FORTIFY_SOURCE

#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <linux/openat2.h>
#include <signal.h>
#include <stdarg.h>
#include <stddef.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/types.h>
#include <sys/uio.h>
#include <unistd.h>

#include "fault_record_line.h"
#include "raw_syscall.h"

#define EXPORT __attribute__((visibility("default")))

enum Family {
    FAMILY_OPEN,
    FAMILY_WRITE,
    FAMILY_PWRITE,
    FAMILY_COPY,
    FAMILY_RENAME,
    FAMILY_UNLINK,
    FAMILY_TRUNCATE,
    FAMILY_UTIMENS,
    FAMILY_SYNC,
    FAMILY_MKDIR,
    FAMILY_CHMOD,
    FAMILY_READ,
    FAMILY_COUNT
};

static const char* const kFamilyNames[FAMILY_COUNT] = {
    "open", "write", "pwrite", "copy", "rename", "unlink", "truncate", "utimens", "sync", "mkdir", "chmod", "read",
};

struct Function {
    const char* name;
    enum Family family;
};

static const struct Function kFunctions[] = {
    {"open", FAMILY_OPEN},          {"openat", FAMILY_OPEN},          {"openat2", FAMILY_OPEN},
    {"creat", FAMILY_OPEN},         {"fopen", FAMILY_OPEN},           {"write", FAMILY_WRITE},
    {"writev", FAMILY_WRITE},       {"pwrite", FAMILY_PWRITE},        {"pwritev", FAMILY_PWRITE},
    {"sendfile", FAMILY_COPY},      {"copy_file_range", FAMILY_COPY}, {"rename", FAMILY_RENAME},
    {"renameat", FAMILY_RENAME},    {"renameat2", FAMILY_RENAME},     {"unlink", FAMILY_UNLINK},
    {"unlinkat", FAMILY_UNLINK},    {"remove", FAMILY_UNLINK},        {"rmdir", FAMILY_UNLINK},
    {"ftruncate", FAMILY_TRUNCATE}, {"truncate", FAMILY_TRUNCATE},    {"utimensat", FAMILY_UTIMENS},
    {"futimens", FAMILY_UTIMENS},   {"syncfs", FAMILY_SYNC},          {"fsync", FAMILY_SYNC},
    {"fdatasync", FAMILY_SYNC},     {"mkdir", FAMILY_MKDIR},          {"mkdirat", FAMILY_MKDIR},
    {"chmod", FAMILY_CHMOD},        {"fchmod", FAMILY_CHMOD},         {"fchmodat", FAMILY_CHMOD},
    {"read", FAMILY_READ},          {"pread", FAMILY_READ},
};

struct ErrnoName {
    const char* name;
    int value;
};

static const struct ErrnoName kErrnoNames[] = {
    {"EPERM", EPERM},
    {"ENOENT", ENOENT},
    {"EINTR", EINTR},
    {"EIO", EIO},
    {"EBADF", EBADF},
    {"EAGAIN", EAGAIN},
    {"ENOMEM", ENOMEM},
    {"EACCES", EACCES},
    {"EBUSY", EBUSY},
    {"EEXIST", EEXIST},
    {"EXDEV", EXDEV},
    {"ENOTDIR", ENOTDIR},
    {"EISDIR", EISDIR},
    {"EINVAL", EINVAL},
    {"ENFILE", ENFILE},
    {"EMFILE", EMFILE},
    {"EFBIG", EFBIG},
    {"ENOSPC", ENOSPC},
    {"EROFS", EROFS},
    {"EMLINK", EMLINK},
    {"ENAMETOOLONG", ENAMETOOLONG},
    {"ENOTEMPTY", ENOTEMPTY},
    {"ELOOP", ELOOP},
    {"EDQUOT", EDQUOT},
    {"ENOSYS", ENOSYS},
};

enum Action { ACTION_NONE, ACTION_ERRNO, ACTION_CRASH, ACTION_SHORT, ACTION_STOP };

enum Verdict { VERDICT_PROCEED, VERDICT_FAIL, VERDICT_SHORT };

static struct {
    int active;
    int counting; /* FAULT_CALL is set */
    int allMutating;
    int family;           /* -1: match by function name */
    const char* function; /* static name from kFunctions */
    unsigned long nth;    /* 0: count only */
    int fromNthOn;        /* act on every call from the nth on */
    enum Action action;
    int error;
    size_t shortLength;
    int hasPathSubstr;
    char pathSubstr[PATH_MAX];
    int hasCountFile;
    char countFile[PATH_MAX];
    int hasRecord;
    char record[PATH_MAX];
    int hasClock;
    time_t clock;
    int locksOff;
    int writeErrorsIgnored;
    pid_t pid;
} config;

enum { STATE_NEW, STATE_LOADING, STATE_READY };
static int state = STATE_NEW;
static unsigned long seen;

/* ---- raw output, no libc buffering or allocation ---- */

static void rawWrite(int fd, const char* text, size_t length) {
    while (length > 0) {
        const long done = rawSyscall(SYS_write, fd, text, length);
        if (done < 0 && errno == EINTR) continue;
        if (done <= 0) return;
        text += done;
        length -= (size_t)done;
    }
}

static size_t formatDecimal(unsigned long value, char* out) {
    char digits[24];
    size_t count = 0;
    do {
        digits[count++] = (char)('0' + value % 10);
        value /= 10;
    } while (value != 0);
    for (size_t i = 0; i < count; ++i) out[i] = digits[count - 1 - i];
    return count;
}

/* Returns 0 when the file cannot be opened. */
static int writeCountFile(unsigned long count) {
    if (!config.hasCountFile) return 1;
    const long fd = rawSyscall(SYS_openat, AT_FDCWD, config.countFile, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
    if (fd < 0) return 0;
    char text[24];
    const size_t length = formatDecimal(count, text);
    text[length] = '\n';
    rawWrite((int)fd, text, length + 1);
    rawSyscall(SYS_close, fd);
    return 1;
}

__attribute__((noreturn)) static void crashNow(void) {
    rawSyscall(SYS_kill, rawSyscall(SYS_getpid), SIGKILL);
    for (;;) rawSyscall(SYS_exit_group, 99);
}

__attribute__((noreturn)) static void configError(const char* variable, const char* value, const char* problem) {
    static const char prefix[] = "fault_injection: ";
    rawWrite(2, prefix, sizeof prefix - 1);
    rawWrite(2, variable, strlen(variable));
    if (value != NULL) {
        rawWrite(2, "=\"", 2);
        rawWrite(2, value, strlen(value));
        rawWrite(2, "\"", 1);
    }
    rawWrite(2, ": ", 2);
    rawWrite(2, problem, strlen(problem));
    rawWrite(2, "\n", 1);
    for (;;) rawSyscall(SYS_exit_group, 98);
}

/* ---- configuration ---- */

static int parseUnsigned(const char* text, unsigned long* value) {
    if (*text == '\0') return 0;
    unsigned long result = 0;
    for (; *text != '\0'; ++text) {
        if (*text < '0' || *text > '9') return 0;
        const unsigned long digit = (unsigned long)(*text - '0');
        if (result > (ULONG_MAX - digit) / 10) return 0;
        result = result * 10 + digit;
    }
    *value = result;
    return 1;
}

static int copyValue(char* to, size_t capacity, const char* value) {
    const size_t length = strlen(value);
    if (length >= capacity) return 0;
    memcpy(to, value, length + 1);
    return 1;
}

static void parseCall(const char* value) {
    if (strcmp(value, "mutating") == 0) {
        config.allMutating = 1;
        return;
    }
    for (int family = 0; family < FAMILY_COUNT; ++family) {
        if (strcmp(value, kFamilyNames[family]) == 0) {
            config.family = family;
            return;
        }
    }
    for (size_t i = 0; i < sizeof kFunctions / sizeof kFunctions[0]; ++i) {
        if (strcmp(value, kFunctions[i].name) == 0) {
            config.function = kFunctions[i].name;
            return;
        }
    }
    configError("FAULT_CALL", value, "names no call family or function");
}

static void parseAction(const char* value) {
    unsigned long number = 0;
    if (strcmp(value, "crash") == 0) {
        config.action = ACTION_CRASH;
    } else if (strcmp(value, "stop") == 0) {
        config.action = ACTION_STOP;
    } else if (strncmp(value, "errno:", 6) == 0) {
        const char* error = value + 6;
        config.action = ACTION_ERRNO;
        if (parseUnsigned(error, &number) && number > 0 && number < 4096) {
            config.error = (int)number;
            return;
        }
        for (size_t i = 0; i < sizeof kErrnoNames / sizeof kErrnoNames[0]; ++i) {
            if (strcmp(error, kErrnoNames[i].name) == 0) {
                config.error = kErrnoNames[i].value;
                return;
            }
        }
        configError("FAULT_ACTION", value, "unknown errno");
    } else if (strncmp(value, "short:", 6) == 0 && parseUnsigned(value + 6, &number)) {
        config.action = ACTION_SHORT;
        config.shortLength = number;
    } else {
        configError("FAULT_ACTION", value, "expected errno:NAME, errno:NUMBER, crash, short:BYTES or stop");
    }
}

static const char* setting(const char* name) {
    const char* value = getenv(name);
    return value != NULL && *value != '\0' ? value : NULL;
}

static void parseClock(const char* value) {
    const int negative = value[0] == '-';
    unsigned long seconds = 0;
    if (!parseUnsigned(value + negative, &seconds) || seconds > (unsigned long)LONG_MAX) {
        configError("FAULT_MTIME", value, "expected whole seconds");
    }
    config.clock = negative ? -(time_t)seconds : (time_t)seconds;
    config.hasClock = 1;
}

static void parseRecord(const char* value) {
    if (value[0] != '/') configError("FAULT_RECORD", value, "not an absolute path");
    if (!copyValue(config.record, sizeof config.record, value)) configError("FAULT_RECORD", NULL, "too long");
    const long fd = rawSyscall(SYS_openat, AT_FDCWD, value, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666);
    if (fd < 0) configError("FAULT_RECORD", value, "cannot be written");
    rawSyscall(SYS_close, fd);
    config.hasRecord = 1;
}

static void loadConfig(void) {
    const char* call = setting("FAULT_CALL");
    const char* nth = setting("FAULT_NTH");
    const char* action = setting("FAULT_ACTION");
    const char* pathSubstr = setting("FAULT_PATH_SUBSTR");
    const char* countFile = setting("FAULT_COUNT_FILE");
    const char* record = setting("FAULT_RECORD");
    const char* clock = setting("FAULT_MTIME");
    const char* locks = setting("FAULT_LOCKS");
    const char* writeErrors = setting("FAULT_WRITE_ERRORS");

    if (call == NULL && (nth != NULL || action != NULL || countFile != NULL ||
                         (pathSubstr != NULL && record == NULL && clock == NULL))) {
        configError("FAULT_CALL", NULL, "missing, but other FAULT_ variables are set");
    }
    if (call == NULL && record == NULL && clock == NULL && locks == NULL && writeErrors == NULL) return;
    if (call != NULL) {
        config.counting = 1;
        config.family = -1;
        parseCall(call);
    }
    if (nth != NULL) {
        char digits[32];
        const size_t length = strlen(nth);
        config.fromNthOn = length > 1 && nth[length - 1] == '+';
        if (!copyValue(digits, sizeof digits, nth)) configError("FAULT_NTH", nth, "expected a number from 1");
        if (config.fromNthOn) digits[length - 1] = '\0';
        if (!parseUnsigned(digits, &config.nth) || config.nth == 0) {
            configError("FAULT_NTH", nth, "expected a number from 1, or one followed by +");
        }
    }
    if (nth != NULL && action == NULL) configError("FAULT_ACTION", NULL, "missing, but FAULT_NTH is set");
    if (nth == NULL && action != NULL) configError("FAULT_NTH", NULL, "missing, but FAULT_ACTION is set");
    if (action != NULL) parseAction(action);
    if (record != NULL) parseRecord(record);
    if (clock != NULL) parseClock(clock);
    if (locks != NULL) {
        if (strcmp(locks, "off") != 0) configError("FAULT_LOCKS", locks, "expected off");
        config.locksOff = 1;
    }
    if (writeErrors != NULL) {
        if (strcmp(writeErrors, "ignore") != 0) configError("FAULT_WRITE_ERRORS", writeErrors, "expected ignore");
        config.writeErrorsIgnored = 1;
    }
    if (pathSubstr != NULL) {
        if (!copyValue(config.pathSubstr, sizeof config.pathSubstr, pathSubstr)) {
            configError("FAULT_PATH_SUBSTR", NULL, "too long");
        }
        config.hasPathSubstr = 1;
    }
    if (countFile != NULL) {
        if (!copyValue(config.countFile, sizeof config.countFile, countFile)) {
            configError("FAULT_COUNT_FILE", NULL, "too long");
        }
        config.hasCountFile = 1;
        if (!writeCountFile(0)) configError("FAULT_COUNT_FILE", countFile, "cannot be written");
    }
    config.pid = (pid_t)rawSyscall(SYS_getpid);
    config.active = 1;

    /* Programs this process starts must not inherit the fault. */
    unsetenv("FAULT_CALL");
    unsetenv("FAULT_NTH");
    unsetenv("FAULT_ACTION");
    unsetenv("FAULT_PATH_SUBSTR");
    unsetenv("FAULT_COUNT_FILE");
    unsetenv("FAULT_RECORD");
    unsetenv("FAULT_MTIME");
    unsetenv("FAULT_LOCKS");
    unsetenv("FAULT_WRITE_ERRORS");
}

/* True when calls are to be inspected. Loads the configuration on first
 * use; calls made while it loads (from getenv's callers, say) pass. */
static int enabled(void) {
    int current = __atomic_load_n(&state, __ATOMIC_ACQUIRE);
    if (current == STATE_NEW) {
        int expected = STATE_NEW;
        if (!__atomic_compare_exchange_n(&state, &expected, STATE_LOADING, 0, __ATOMIC_ACQ_REL, __ATOMIC_ACQUIRE)) {
            return 0;
        }
        loadConfig();
        __atomic_store_n(&state, STATE_READY, __ATOMIC_RELEASE);
        current = STATE_READY;
    }
    return current == STATE_READY && config.active && (pid_t)rawSyscall(SYS_getpid) == config.pid;
}

__attribute__((constructor)) static void loadAtStartup(void) {
    const int saved = errno;
    (void)enabled();
    errno = saved;
}

/* ---- which call is this ---- */

struct Target {
    int dirfd;        /* with path; AT_FDCWD when not an *at call */
    const char* path; /* NULL: match on fd */
    int dirfd2;
    const char* path2; /* second name of rename, or NULL */
    int fd;
};

#define PATH_TARGET(p) ((struct Target){AT_FDCWD, (p), AT_FDCWD, NULL, -1})
#define AT_TARGET(d, p) ((struct Target){(d), (p), AT_FDCWD, NULL, -1})
#define FD_TARGET(f) ((struct Target){AT_FDCWD, NULL, AT_FDCWD, NULL, (f)})

/* Path of an open descriptor as /proc shows it, or 0 on failure. */
static size_t descriptorPath(int fd, char* out, size_t capacity) {
    char link[32] = "/proc/self/fd/";
    size_t at = strlen(link);
    if (fd < 0) return 0;
    at += formatDecimal((unsigned long)fd, link + at);
    link[at] = '\0';
    const long length = rawSyscall(SYS_readlinkat, AT_FDCWD, link, out, capacity - 1);
    if (length <= 0) return 0;
    out[length] = '\0';
    return (size_t)length;
}

static int pathMatches(int dirfd, const char* path) {
    if (path == NULL) return 0;
    if (strstr(path, config.pathSubstr) != NULL) return 1;
    if (dirfd == AT_FDCWD || path[0] == '/') return 0;
    char joined[2 * PATH_MAX + 2];
    const size_t length = descriptorPath(dirfd, joined, PATH_MAX);
    if (length == 0) return 0;
    joined[length] = '/';
    if (!copyValue(joined + length + 1, sizeof joined - length - 1, path)) return 0;
    return strstr(joined, config.pathSubstr) != NULL;
}

static int targetMatches(const struct Target* target) {
    if (target->path != NULL) {
        return pathMatches(target->dirfd, target->path) || pathMatches(target->dirfd2, target->path2);
    }
    char path[PATH_MAX];
    return descriptorPath(target->fd, path, sizeof path) != 0 && strstr(path, config.pathSubstr) != NULL;
}

static int isCoverageCounts(const char* path) {
    static const char suffix[] = ".gcda";
    const size_t length = path == NULL ? 0 : strlen(path);
    return length >= sizeof suffix - 1 && strcmp(path + length - (sizeof suffix - 1), suffix) == 0;
}

static int namesCoverageCounts(const struct Target* target) {
    return isCoverageCounts(target->path) || isCoverageCounts(target->path2);
}

static int callMatches(const char* function, enum Family family, int mutating) {
    if (config.allMutating) return mutating;
    if (config.family >= 0) return config.family == (int)family;
    return strcmp(config.function, function) == 0;
}

/* Counts the call if it matches and says what to do with it; does not
 * return when the call is to crash. errno is kept unless the verdict is
 * VERDICT_FAIL, which sets it. */
static enum Verdict decide(const char* function, enum Family family, int mutating, struct Target target) {
    const int saved = errno;
    if (!enabled() || !config.counting || !callMatches(function, family, mutating) || namesCoverageCounts(&target) ||
        (config.hasPathSubstr && !targetMatches(&target))) {
        errno = saved;
        return VERDICT_PROCEED;
    }
    const unsigned long count = __atomic_add_fetch(&seen, 1, __ATOMIC_ACQ_REL);
    (void)writeCountFile(count); /* checked at load */
    errno = saved;
    if (count != config.nth && !(config.fromNthOn && count > config.nth)) return VERDICT_PROCEED;
    switch (config.action) {
        case ACTION_CRASH:
            crashNow();
        case ACTION_ERRNO:
            errno = config.error;
            return VERDICT_FAIL;
        case ACTION_SHORT:
            return VERDICT_SHORT;
        case ACTION_STOP:
            rawSyscall(SYS_kill, rawSyscall(SYS_getpid), SIGSTOP);
            errno = saved;
            break;
        case ACTION_NONE:
            break;
    }
    return VERDICT_PROCEED;
}

/* The definition the call would have reached without the shim. A missing
 * one means the shim cannot work in this process at all. */
static void* next(void** slot, const char* name) {
    void* function = __atomic_load_n(slot, __ATOMIC_ACQUIRE);
    if (function == NULL) {
        function = dlsym(RTLD_NEXT, name);
        if (function == NULL) configError(name, NULL, "no next definition to forward to");
        __atomic_store_n(slot, function, __ATOMIC_RELEASE);
    }
    return function;
}

static int openMutates(int flags) {
    return (flags & (O_WRONLY | O_RDWR | O_CREAT | O_TRUNC)) != 0 || (flags & O_TMPFILE) == O_TMPFILE;
}

static int openNeedsMode(int flags) { return (flags & O_CREAT) != 0 || (flags & O_TMPFILE) == O_TMPFILE; }

static size_t shortened(size_t count) { return count < config.shortLength ? count : config.shortLength; }

/* A failed write's or sync's result as the caller is to see it. */
static ssize_t writeResult(ssize_t result, size_t wanted) {
    const int saved = errno;
    const int ignored = result < 0 && enabled() && config.writeErrorsIgnored;
    errno = saved;
    return ignored ? (ssize_t)wanted : result;
}

static size_t vectorBytes(const struct iovec* vector, int count) {
    size_t total = 0;
    for (int i = 0; i < count; ++i) total += vector[i].iov_len;
    return total;
}

/* ---- recording and the fake clock ---- */

/* An absolute name: a directory's path, '/', a name of up to PATH_MAX. */
#define NAME_CAPACITY (2 * PATH_MAX + 2)

__attribute__((noreturn)) static void recordFailed(const char* problem) {
    configError("FAULT_RECORD", config.record, problem);
}

/* Whether the call's effect is to be recorded or given the fake time. A
 * NULL target passes any path filter. Keeps errno. */
static int watching(const struct Target* target) {
    const int saved = errno;
    const int watched =
        enabled() && (config.hasRecord || config.hasClock) &&
        (target == NULL || (!namesCoverageCounts(target) && (!config.hasPathSubstr || targetMatches(target))));
    errno = saved;
    return watched;
}

/* stat of the file a target names (its descriptor when it has no path),
 * following a last symbolic link unless `noFollow`. */
static int statTarget(const struct Target* target, int noFollow, struct stat* status) {
    if (target->path == NULL) return rawSyscall(SYS_fstat, target->fd, status) == 0;
    return rawSyscall(SYS_newfstatat, target->dirfd, target->path, status, noFollow ? AT_SYMLINK_NOFOLLOW : 0) == 0;
}

/* The target's absolute name; ends the process when there is none. */
static void nameOf(const struct Target* target, char* out) {
    if (target->path == NULL) {
        if (descriptorPath(target->fd, out, NAME_CAPACITY) == 0) recordFailed("a descriptor without a path");
        return;
    }
    if (target->path[0] == '/') {
        if (!copyValue(out, NAME_CAPACITY, target->path)) recordFailed("a path too long");
        return;
    }
    size_t length = 0;
    if (target->dirfd == AT_FDCWD) {
        const long size = rawSyscall(SYS_getcwd, out, PATH_MAX);
        length = size > 0 ? (size_t)size - 1 : 0;
    } else {
        length = descriptorPath(target->dirfd, out, PATH_MAX);
    }
    if (length == 0) recordFailed("no directory path to join a relative name to");
    if (target->path[0] == '\0') return;
    if (out[length - 1] != '/') out[length++] = '/';
    if (!copyValue(out + length, NAME_CAPACITY - length, target->path)) recordFailed("a path too long");
}

static void appendLine(struct RecordLine* line) {
    if (!recordLineAppend(line, config.record)) recordFailed("cannot be appended to");
}

static void beginLine(struct RecordLine* line, const char* kind, size_t pathBytes, size_t dataBytes) {
    if (!recordLineBegin(line, kind, pathBytes, dataBytes)) recordFailed("no memory for a line");
}

/* "KIND PATH INO", with "MTIME" when `withTime`: calls that change no
 * data. */
static void recordNamed(const char* kind, const struct Target* target, int noFollow, int withTime) {
    if (!config.hasRecord) return;
    const int saved = errno;
    char name[NAME_CAPACITY];
    nameOf(target, name);
    struct stat status = {0};
    (void)statTarget(target, noFollow, &status); /* the call just succeeded on it */
    struct RecordLine line;
    beginLine(&line, kind, strlen(name), 0);
    recordLinePath(&line, name);
    recordLineUnsigned(&line, status.st_ino);
    if (withTime) recordLineTime(&line, &status.st_mtim);
    appendLine(&line);
    errno = saved;
}

/* Gives a regular file the fake time and returns its stat after that; 0
 * for anything else. */
static int changedRegularFile(const struct Target* target, struct stat* status) {
    if (!statTarget(target, 0, status) || !S_ISREG(status->st_mode)) return 0;
    if (!config.hasClock) return 1;
    const struct timespec times[2] = {{config.clock, 0}, {config.clock, 0}};
    const long done = target->path == NULL ? rawSyscall(SYS_utimensat, target->fd, NULL, times, 0)
                                           : rawSyscall(SYS_utimensat, target->dirfd, target->path, times, 0);
    if (done != 0) configError("FAULT_MTIME", NULL, "cannot set a file's time");
    return statTarget(target, 0, status);
}

/* An open that can create or truncate: whether to look at it after the
 * call, and whether its name existed before. */
static int openChanges(int flags) { return (flags & (O_CREAT | O_TRUNC)) != 0 && (flags & O_TMPFILE) != O_TMPFILE; }

static int watchOpen(const struct Target* target, int flags, int* existed) {
    if (!openChanges(flags) || !watching(target)) return 0;
    const int saved = errno;
    struct stat status;
    *existed = statTarget(target, 1, &status);
    errno = saved;
    return 1;
}

static void afterOpen(const struct Target* named, int fd, int flags, int existed) {
    if (existed && (flags & O_TRUNC) == 0) return;
    const int saved = errno;
    const struct Target opened = FD_TARGET(fd);
    struct stat status;
    if (changedRegularFile(&opened, &status) && config.hasRecord) {
        char name[NAME_CAPACITY];
        nameOf(named, name);
        struct RecordLine line;
        beginLine(&line, existed ? "truncate" : "create", strlen(name), 0);
        recordLinePath(&line, name);
        recordLineUnsigned(&line, status.st_ino);
        if (existed) recordLineUnsigned(&line, 0);
        recordLineTime(&line, &status.st_mtim);
        appendLine(&line);
    }
    errno = saved;
}

/* Where `done` bytes just written through `fd` went: `offset` when the
 * call named one (-1: it wrote at the file position), the old end of file
 * under O_APPEND. */
static off_t writtenAt(int fd, off_t offset, size_t done, const struct stat* after) {
    if (rawSyscall(SYS_fcntl, fd, F_GETFL) & O_APPEND) return after->st_size - (off_t)done;
    if (offset >= 0) return offset;
    return (off_t)rawSyscall(SYS_lseek, fd, 0, SEEK_CUR) - (off_t)done;
}

static void recordWrite(const char* name, const struct stat* status, off_t offset, const struct iovec* buffers,
                        int bufferCount, size_t done, int known) {
    struct RecordLine line;
    beginLine(&line, "write", strlen(name), known ? done : 0);
    recordLinePath(&line, name);
    recordLineUnsigned(&line, status->st_ino);
    recordLineSigned(&line, offset);
    if (known) {
        recordLineHex(&line, buffers, bufferCount, done);
    } else {
        recordLineUnknown(&line);
    }
    recordLineTime(&line, &status->st_mtim);
    appendLine(&line);
}

static void afterWrite(int fd, off_t offset, const struct iovec* buffers, int bufferCount, ssize_t done) {
    const int saved = errno;
    const struct Target written = FD_TARGET(fd);
    struct stat status;
    if (changedRegularFile(&written, &status) && config.hasRecord) {
        char name[NAME_CAPACITY];
        nameOf(&written, name);
        recordWrite(name, &status, writtenAt(fd, offset, (size_t)done, &status), buffers, bufferCount, (size_t)done, 1);
    }
    errno = saved;
}

static int readAll(int fd, unsigned char* buffer, size_t count, off_t offset) {
    while (count > 0) {
        const long got = rawSyscall(SYS_pread64, fd, buffer, count, offset);
        if (got < 0 && errno == EINTR) continue;
        if (got <= 0) return 0;
        buffer += got;
        count -= (size_t)got;
        offset += got;
    }
    return 1;
}

/* sendfile and copy_file_range: the copied bytes are read back, from the
 * destination when it is open for reading, else from the source. Offsets
 * are those before the call, -1 for the file position. */
static void afterCopy(int outFd, off_t outOffset, int inFd, off_t inOffset, ssize_t done) {
    const int saved = errno;
    const struct Target written = FD_TARGET(outFd);
    struct stat status;
    if (changedRegularFile(&written, &status) && config.hasRecord) {
        const size_t count = (size_t)done;
        if (inOffset < 0) inOffset = (off_t)rawSyscall(SYS_lseek, inFd, 0, SEEK_CUR) - (off_t)count;
        outOffset = writtenAt(outFd, outOffset, count, &status);
        unsigned char* bytes = recordMap(count);
        if (bytes == NULL) recordFailed("no memory for copied bytes");
        const int known = readAll(outFd, bytes, count, outOffset) || readAll(inFd, bytes, count, inOffset);
        const struct iovec buffer = {bytes, count};
        char name[NAME_CAPACITY];
        nameOf(&written, name);
        recordWrite(name, &status, outOffset, &buffer, 1, count, known);
        recordUnmap(bytes, count);
    }
    errno = saved;
}

static void afterTruncate(const struct Target* target, off_t length) {
    const int saved = errno;
    struct stat status;
    if (changedRegularFile(target, &status) && config.hasRecord) {
        char name[NAME_CAPACITY];
        nameOf(target, name);
        struct RecordLine line;
        beginLine(&line, "truncate", strlen(name), 0);
        recordLinePath(&line, name);
        recordLineUnsigned(&line, status.st_ino);
        recordLineSigned(&line, length);
        recordLineTime(&line, &status.st_mtim);
        appendLine(&line);
    }
    errno = saved;
}

/* What a name held before a call removes or replaces it; st_ino 0 when
 * nothing. */
static struct stat entryBefore(const struct Target* target) {
    const int saved = errno;
    struct stat status = {0};
    if (!statTarget(target, 1, &status)) status.st_ino = 0;
    errno = saved;
    return status;
}

/* unlink and rmdir fail on the other kind, so the kind of what was there
 * tells which one succeeded. */
static void afterRemoval(const struct Target* target, const struct stat* before) {
    if (!config.hasRecord) return;
    const int saved = errno;
    const int directory = before->st_ino != 0 && S_ISDIR(before->st_mode);
    char name[NAME_CAPACITY];
    nameOf(target, name);
    struct RecordLine line;
    beginLine(&line, directory ? "rmdir" : "unlink", strlen(name), 0);
    recordLinePath(&line, name);
    if (!directory) recordLineUnsigned(&line, before->st_ino);
    appendLine(&line);
    errno = saved;
}

static void afterRename(const struct Target* target, ino_t moved, ino_t replaced) {
    if (!config.hasRecord) return;
    const int saved = errno;
    const struct Target to = AT_TARGET(target->dirfd2, target->path2);
    char from[NAME_CAPACITY];
    char toName[NAME_CAPACITY];
    nameOf(target, from);
    nameOf(&to, toName);
    struct RecordLine line;
    beginLine(&line, "rename", strlen(from) + strlen(toName), 0);
    recordLinePath(&line, from);
    recordLinePath(&line, toName);
    recordLineUnsigned(&line, moved);
    recordLineUnsigned(&line, replaced);
    appendLine(&line);
    errno = saved;
}

static void afterMkdir(const struct Target* target) {
    if (!config.hasRecord) return;
    const int saved = errno;
    char name[NAME_CAPACITY];
    nameOf(target, name);
    struct RecordLine line;
    beginLine(&line, "mkdir", strlen(name), 0);
    recordLinePath(&line, name);
    appendLine(&line);
    errno = saved;
}

static void afterSyncfs(void) {
    if (!config.hasRecord) return;
    struct RecordLine line;
    const int saved = errno;
    beginLine(&line, "syncfs", 0, 0);
    appendLine(&line);
    errno = saved;
}

/* ---- open ---- */

typedef int (*OpenFn)(const char*, int, ...);
typedef int (*OpenatFn)(int, const char*, int, ...);
typedef int (*Open2Fn)(const char*, int);
typedef int (*Openat2Fn)(int, const char*, int);
typedef int (*CreatFn)(const char*, mode_t);
typedef FILE* (*FopenFn)(const char*, const char*);

static int forwardOpen(void** slot, const char* symbol, const char* path, int flags, mode_t mode) {
    const OpenFn real = (OpenFn)next(slot, symbol);
    const struct Target target = PATH_TARGET(path);
    if (decide("open", FAMILY_OPEN, openMutates(flags), target) == VERDICT_FAIL) return -1;
    int existed = 0;
    const int watched = watchOpen(&target, flags, &existed);
    const int fd = real(path, flags, mode);
    if (fd >= 0 && watched) afterOpen(&target, fd, flags, existed);
    return fd;
}

static int forwardOpenat(void** slot, const char* symbol, int dirfd, const char* path, int flags, mode_t mode) {
    const OpenatFn real = (OpenatFn)next(slot, symbol);
    const struct Target target = AT_TARGET(dirfd, path);
    if (decide("openat", FAMILY_OPEN, openMutates(flags), target) == VERDICT_FAIL) return -1;
    int existed = 0;
    const int watched = watchOpen(&target, flags, &existed);
    const int fd = real(dirfd, path, flags, mode);
    if (fd >= 0 && watched) afterOpen(&target, fd, flags, existed);
    return fd;
}

EXPORT int open(const char* path, int flags, ...) {
    static void* slot;
    va_list args;
    va_start(args, flags);
    const mode_t mode = openNeedsMode(flags) ? va_arg(args, mode_t) : 0;
    va_end(args);
    return forwardOpen(&slot, "open", path, flags, mode);
}

EXPORT int open64(const char* path, int flags, ...) {
    static void* slot;
    va_list args;
    va_start(args, flags);
    const mode_t mode = openNeedsMode(flags) ? va_arg(args, mode_t) : 0;
    va_end(args);
    return forwardOpen(&slot, "open64", path, flags, mode);
}

EXPORT int openat(int dirfd, const char* path, int flags, ...) {
    static void* slot;
    va_list args;
    va_start(args, flags);
    const mode_t mode = openNeedsMode(flags) ? va_arg(args, mode_t) : 0;
    va_end(args);
    return forwardOpenat(&slot, "openat", dirfd, path, flags, mode);
}

EXPORT int openat64(int dirfd, const char* path, int flags, ...) {
    static void* slot;
    va_list args;
    va_start(args, flags);
    const mode_t mode = openNeedsMode(flags) ? va_arg(args, mode_t) : 0;
    va_end(args);
    return forwardOpenat(&slot, "openat64", dirfd, path, flags, mode);
}

/* Fortified callers reach these instead of open and openat. */
int __open_2(const char* path, int flags);
int __open64_2(const char* path, int flags);
int __openat_2(int dirfd, const char* path, int flags);
int __openat64_2(int dirfd, const char* path, int flags);

static int forwardOpen2(void** slot, const char* symbol, const char* path, int flags) {
    const Open2Fn real = (Open2Fn)next(slot, symbol);
    const struct Target target = PATH_TARGET(path);
    if (decide("open", FAMILY_OPEN, openMutates(flags), target) == VERDICT_FAIL) return -1;
    int existed = 0;
    const int watched = watchOpen(&target, flags, &existed);
    const int fd = real(path, flags);
    if (fd >= 0 && watched) afterOpen(&target, fd, flags, existed);
    return fd;
}

static int forwardOpenat2(void** slot, const char* symbol, int dirfd, const char* path, int flags) {
    const Openat2Fn real = (Openat2Fn)next(slot, symbol);
    const struct Target target = AT_TARGET(dirfd, path);
    if (decide("openat", FAMILY_OPEN, openMutates(flags), target) == VERDICT_FAIL) return -1;
    int existed = 0;
    const int watched = watchOpen(&target, flags, &existed);
    const int fd = real(dirfd, path, flags);
    if (fd >= 0 && watched) afterOpen(&target, fd, flags, existed);
    return fd;
}

EXPORT int __open_2(const char* path, int flags) {
    static void* slot;
    return forwardOpen2(&slot, "__open_2", path, flags);
}

EXPORT int __open64_2(const char* path, int flags) {
    static void* slot;
    return forwardOpen2(&slot, "__open64_2", path, flags);
}

EXPORT int __openat_2(int dirfd, const char* path, int flags) {
    static void* slot;
    return forwardOpenat2(&slot, "__openat_2", dirfd, path, flags);
}

EXPORT int __openat64_2(int dirfd, const char* path, int flags) {
    static void* slot;
    return forwardOpenat2(&slot, "__openat64_2", dirfd, path, flags);
}

static int forwardCreat(void** slot, const char* symbol, const char* path, mode_t mode) {
    const CreatFn real = (CreatFn)next(slot, symbol);
    const struct Target target = PATH_TARGET(path);
    if (decide("creat", FAMILY_OPEN, 1, target) == VERDICT_FAIL) return -1;
    const int flags = O_WRONLY | O_CREAT | O_TRUNC;
    int existed = 0;
    const int watched = watchOpen(&target, flags, &existed);
    const int fd = real(path, mode);
    if (fd >= 0 && watched) afterOpen(&target, fd, flags, existed);
    return fd;
}

EXPORT int creat(const char* path, mode_t mode) {
    static void* slot;
    return forwardCreat(&slot, "creat", path, mode);
}

EXPORT int creat64(const char* path, mode_t mode) {
    static void* slot;
    return forwardCreat(&slot, "creat64", path, mode);
}

/* openat2 has no glibc wrapper: programs reach it through syscall(), whose
 * other numbers pass straight to the kernel. */
EXPORT long syscall(long number, ...) {
    va_list args;
    va_start(args, number);
    long a[6];
    for (int i = 0; i < 6; ++i) a[i] = va_arg(args, long);
    va_end(args);
    if (number != SYS_openat2) return rawSyscall6(number, a[0], a[1], a[2], a[3], a[4], a[5]);
    const struct open_how* how = (const struct open_how*)a[2];
    const int flags = how != NULL ? (int)how->flags : 0;
    const struct Target target = AT_TARGET((int)a[0], (const char*)a[1]);
    if (decide("openat2", FAMILY_OPEN, openMutates(flags), target) == VERDICT_FAIL) return -1;
    int existed = 0;
    const int watched = watchOpen(&target, flags, &existed);
    const long fd = rawSyscall(SYS_openat2, a[0], a[1], a[2], a[3]);
    if (fd >= 0 && watched) afterOpen(&target, (int)fd, flags, existed);
    return fd;
}

/* glibc's stdio opens through internal calls the shim cannot see. */
static FILE* forwardFopen(void** slot, const char* symbol, const char* path, const char* mode) {
    const FopenFn real = (FopenFn)next(slot, symbol);
    const struct Target target = PATH_TARGET(path);
    if (decide("fopen", FAMILY_OPEN, strpbrk(mode, "wa+") != NULL, target) == VERDICT_FAIL) return NULL;
    const int flags = mode[0] == 'w' ? O_CREAT | O_TRUNC : mode[0] == 'a' ? O_CREAT : 0;
    int existed = 0;
    const int watched = watchOpen(&target, flags, &existed);
    FILE* stream = real(path, mode);
    if (stream != NULL && watched) afterOpen(&target, fileno(stream), flags, existed);
    return stream;
}

EXPORT FILE* fopen(const char* path, const char* mode) {
    static void* slot;
    return forwardFopen(&slot, "fopen", path, mode);
}

EXPORT FILE* fopen64(const char* path, const char* mode) {
    static void* slot;
    return forwardFopen(&slot, "fopen64", path, mode);
}

/* ---- write ---- */

typedef ssize_t (*WriteFn)(int, const void*, size_t);
typedef ssize_t (*WritevFn)(int, const struct iovec*, int);
typedef ssize_t (*PwriteFn)(int, const void*, size_t, off_t);
typedef ssize_t (*PwritevFn)(int, const struct iovec*, int, off_t);
typedef ssize_t (*SendfileFn)(int, int, off_t*, size_t);
typedef ssize_t (*CopyFileRangeFn)(int, loff_t*, int, loff_t*, size_t, unsigned int);

/* The 64-bit variants share the plain functions' forwarding. */
_Static_assert(sizeof(off_t) == sizeof(off64_t), "off_t must be 64 bits");

/* write, and pwrite when `positioned`. */
static ssize_t forwardWrite(void** slot, const char* symbol, int positioned, int fd, const void* data, size_t count,
                            off_t offset) {
    void* const real = next(slot, symbol);
    const struct Target target = FD_TARGET(fd);
    const enum Family family = positioned ? FAMILY_PWRITE : FAMILY_WRITE;
    switch (decide(positioned ? "pwrite" : "write", family, 1, target)) {
        case VERDICT_FAIL:
            return writeResult(-1, count);
        case VERDICT_SHORT:
            count = shortened(count);
            break;
        case VERDICT_PROCEED:
            break;
    }
    const int watched = watching(&target);
    const ssize_t done = positioned ? ((PwriteFn)real)(fd, data, count, offset) : ((WriteFn)real)(fd, data, count);
    const struct iovec buffer = {(void*)data, count};
    if (done >= 0 && watched) afterWrite(fd, positioned ? offset : -1, &buffer, 1, done);
    return writeResult(done, count);
}

typedef ssize_t (*ReadFn)(int, void*, size_t);
typedef ssize_t (*PreadFn)(int, void*, size_t, off_t);

/* read, and pread when `positioned`. */
static ssize_t forwardRead(void** slot, const char* symbol, int positioned, int fd, void* data, size_t count,
                           off_t offset) {
    void* const real = next(slot, symbol);
    if (decide(positioned ? "pread" : "read", FAMILY_READ, 0, FD_TARGET(fd)) == VERDICT_FAIL) return -1;
    return positioned ? ((PreadFn)real)(fd, data, count, offset) : ((ReadFn)real)(fd, data, count);
}

EXPORT ssize_t read(int fd, void* data, size_t count) {
    static void* slot;
    return forwardRead(&slot, "read", 0, fd, data, count, 0);
}

EXPORT ssize_t pread(int fd, void* data, size_t count, off_t offset) {
    static void* slot;
    return forwardRead(&slot, "pread", 1, fd, data, count, offset);
}

EXPORT ssize_t pread64(int fd, void* data, size_t count, off64_t offset) {
    static void* slot;
    return forwardRead(&slot, "pread64", 1, fd, data, count, offset);
}

/* The fortified variants check the buffer's size in the real one. */
typedef ssize_t (*ReadChkFn)(int, void*, size_t, size_t);
typedef ssize_t (*PreadChkFn)(int, void*, size_t, off_t, size_t);
ssize_t __read_chk(int fd, void* data, size_t count, size_t capacity);
ssize_t __pread_chk(int fd, void* data, size_t count, off_t offset, size_t capacity);
ssize_t __pread64_chk(int fd, void* data, size_t count, off64_t offset, size_t capacity);

EXPORT ssize_t __read_chk(int fd, void* data, size_t count, size_t capacity) {
    static void* slot;
    const ReadChkFn real = (ReadChkFn)next(&slot, "__read_chk");
    if (decide("read", FAMILY_READ, 0, FD_TARGET(fd)) == VERDICT_FAIL) return -1;
    return real(fd, data, count, capacity);
}

static ssize_t forwardPreadChk(void** slot, const char* symbol, int fd, void* data, size_t count, off_t offset,
                               size_t capacity) {
    const PreadChkFn real = (PreadChkFn)next(slot, symbol);
    if (decide("pread", FAMILY_READ, 0, FD_TARGET(fd)) == VERDICT_FAIL) return -1;
    return real(fd, data, count, offset, capacity);
}

EXPORT ssize_t __pread_chk(int fd, void* data, size_t count, off_t offset, size_t capacity) {
    static void* slot;
    return forwardPreadChk(&slot, "__pread_chk", fd, data, count, offset, capacity);
}

EXPORT ssize_t __pread64_chk(int fd, void* data, size_t count, off64_t offset, size_t capacity) {
    static void* slot;
    return forwardPreadChk(&slot, "__pread64_chk", fd, data, count, offset, capacity);
}

EXPORT ssize_t write(int fd, const void* data, size_t count) {
    static void* slot;
    return forwardWrite(&slot, "write", 0, fd, data, count, 0);
}

EXPORT ssize_t pwrite(int fd, const void* data, size_t count, off_t offset) {
    static void* slot;
    return forwardWrite(&slot, "pwrite", 1, fd, data, count, offset);
}

EXPORT ssize_t pwrite64(int fd, const void* data, size_t count, off64_t offset) {
    static void* slot;
    return forwardWrite(&slot, "pwrite64", 1, fd, data, count, offset);
}

/* writev, and pwritev when `positioned`. */
static ssize_t forwardWritev(void** slot, const char* symbol, int positioned, int fd, const struct iovec* vector,
                             int count, off_t offset) {
    void* const real = next(slot, symbol);
    const struct Target target = FD_TARGET(fd);
    const enum Family family = positioned ? FAMILY_PWRITE : FAMILY_WRITE;
    if (decide(positioned ? "pwritev" : "writev", family, 1, target) == VERDICT_FAIL) {
        return writeResult(-1, vectorBytes(vector, count));
    }
    const int watched = watching(&target);
    const ssize_t done =
        positioned ? ((PwritevFn)real)(fd, vector, count, offset) : ((WritevFn)real)(fd, vector, count);
    if (done >= 0 && watched) afterWrite(fd, positioned ? offset : -1, vector, count, done);
    return writeResult(done, vectorBytes(vector, count));
}

EXPORT ssize_t writev(int fd, const struct iovec* vector, int count) {
    static void* slot;
    return forwardWritev(&slot, "writev", 0, fd, vector, count, 0);
}

EXPORT ssize_t pwritev(int fd, const struct iovec* vector, int count, off_t offset) {
    static void* slot;
    return forwardWritev(&slot, "pwritev", 1, fd, vector, count, offset);
}

EXPORT ssize_t pwritev64(int fd, const struct iovec* vector, int count, off64_t offset) {
    static void* slot;
    return forwardWritev(&slot, "pwritev64", 1, fd, vector, count, offset);
}

/* sendfile and sendfile64 take the same arguments where off_t is 64 bits. */
static ssize_t forwardSendfile(void** slot, const char* symbol, int outFd, int inFd, off_t* offset, size_t count) {
    const SendfileFn real = (SendfileFn)next(slot, symbol);
    const struct Target target = FD_TARGET(outFd);
    if (decide("sendfile", FAMILY_COPY, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const off_t inOffset = offset != NULL ? *offset : -1;
    const ssize_t done = real(outFd, inFd, offset, count);
    if (done >= 0 && watched) afterCopy(outFd, -1, inFd, inOffset, done);
    return done;
}

EXPORT ssize_t sendfile(int outFd, int inFd, off_t* offset, size_t count) {
    static void* slot;
    return forwardSendfile(&slot, "sendfile", outFd, inFd, offset, count);
}

EXPORT ssize_t sendfile64(int outFd, int inFd, off64_t* offset, size_t count) {
    static void* slot;
    return forwardSendfile(&slot, "sendfile64", outFd, inFd, offset, count);
}

EXPORT ssize_t copy_file_range(int inFd, loff_t* inOffset, int outFd, loff_t* outOffset, size_t count,
                               unsigned int flags) {
    static void* slot;
    const CopyFileRangeFn real = (CopyFileRangeFn)next(&slot, "copy_file_range");
    const struct Target target = FD_TARGET(outFd);
    if (decide("copy_file_range", FAMILY_COPY, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const off_t inStart = inOffset != NULL ? *inOffset : -1;
    const off_t outStart = outOffset != NULL ? *outOffset : -1;
    const ssize_t done = real(inFd, inOffset, outFd, outOffset, count, flags);
    if (done >= 0 && watched) afterCopy(outFd, outStart, inFd, inStart, done);
    return done;
}

/* ---- rename and removal ---- */

typedef int (*RenameFn)(const char*, const char*);
typedef int (*RenameatFn)(int, const char*, int, const char*);
typedef int (*Renameat2Fn)(int, const char*, int, const char*, unsigned int);
typedef int (*PathFn)(const char*);
typedef int (*UnlinkatFn)(int, const char*, int);

/* Whether the rename is watched; then what both names held before it. */
static int watchRename(const struct Target* target, struct stat* from, struct stat* to) {
    if (!watching(target)) return 0;
    const struct Target toTarget = AT_TARGET(target->dirfd2, target->path2);
    *from = entryBefore(target);
    *to = entryBefore(&toTarget);
    return 1;
}

EXPORT int rename(const char* from, const char* to) {
    static void* slot;
    const RenameFn real = (RenameFn)next(&slot, "rename");
    const struct Target target = {AT_FDCWD, from, AT_FDCWD, to, -1};
    if (decide("rename", FAMILY_RENAME, 1, target) == VERDICT_FAIL) return -1;
    struct stat moved, replaced;
    const int watched = watchRename(&target, &moved, &replaced);
    const int result = real(from, to);
    if (result == 0 && watched) afterRename(&target, moved.st_ino, replaced.st_ino);
    return result;
}

EXPORT int renameat(int fromDir, const char* from, int toDir, const char* to) {
    static void* slot;
    const RenameatFn real = (RenameatFn)next(&slot, "renameat");
    const struct Target target = {fromDir, from, toDir, to, -1};
    if (decide("renameat", FAMILY_RENAME, 1, target) == VERDICT_FAIL) return -1;
    struct stat moved, replaced;
    const int watched = watchRename(&target, &moved, &replaced);
    const int result = real(fromDir, from, toDir, to);
    if (result == 0 && watched) afterRename(&target, moved.st_ino, replaced.st_ino);
    return result;
}

EXPORT int renameat2(int fromDir, const char* from, int toDir, const char* to, unsigned int flags) {
    static void* slot;
    const Renameat2Fn real = (Renameat2Fn)next(&slot, "renameat2");
    const struct Target target = {fromDir, from, toDir, to, -1};
    if (decide("renameat2", FAMILY_RENAME, 1, target) == VERDICT_FAIL) return -1;
    struct stat moved, replaced;
    const int watched = watchRename(&target, &moved, &replaced);
    const int result = real(fromDir, from, toDir, to, flags);
    if (result == 0 && watched) afterRename(&target, moved.st_ino, replaced.st_ino);
    return result;
}

/* unlink, remove and rmdir. */
static int forwardRemoval(void** slot, const char* symbol, const char* path) {
    const PathFn real = (PathFn)next(slot, symbol);
    const struct Target target = PATH_TARGET(path);
    if (decide(symbol, FAMILY_UNLINK, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const struct stat before = watched ? entryBefore(&target) : (struct stat){0};
    const int result = real(path);
    if (result == 0 && watched) afterRemoval(&target, &before);
    return result;
}

EXPORT int unlink(const char* path) {
    static void* slot;
    return forwardRemoval(&slot, "unlink", path);
}

/* remove() reaches unlink or rmdir inside glibc, so it is counted once. */
EXPORT int remove(const char* path) {
    static void* slot;
    return forwardRemoval(&slot, "remove", path);
}

EXPORT int rmdir(const char* path) {
    static void* slot;
    return forwardRemoval(&slot, "rmdir", path);
}

EXPORT int unlinkat(int dirfd, const char* path, int flags) {
    static void* slot;
    const UnlinkatFn real = (UnlinkatFn)next(&slot, "unlinkat");
    const struct Target target = AT_TARGET(dirfd, path);
    if (decide("unlinkat", FAMILY_UNLINK, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const struct stat before = watched ? entryBefore(&target) : (struct stat){0};
    const int result = real(dirfd, path, flags);
    if (result == 0 && watched) afterRemoval(&target, &before);
    return result;
}

/* ---- size, times, syncing, directories, modes ---- */

typedef int (*FtruncateFn)(int, off_t);
typedef int (*TruncateFn)(const char*, off_t);
typedef int (*UtimensatFn)(int, const char*, const struct timespec*, int);
typedef int (*FutimensFn)(int, const struct timespec*);
typedef int (*FdFn)(int);
typedef int (*PathModeFn)(const char*, mode_t);
typedef int (*FdModeFn)(int, mode_t);
typedef int (*AtModeFn)(int, const char*, mode_t);
typedef int (*FchmodatFn)(int, const char*, mode_t, int);

static int forwardFtruncate(void** slot, const char* symbol, int fd, off_t length) {
    const FtruncateFn real = (FtruncateFn)next(slot, symbol);
    const struct Target target = FD_TARGET(fd);
    if (decide("ftruncate", FAMILY_TRUNCATE, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const int result = real(fd, length);
    if (result == 0 && watched) afterTruncate(&target, length);
    return result;
}

EXPORT int ftruncate(int fd, off_t length) {
    static void* slot;
    return forwardFtruncate(&slot, "ftruncate", fd, length);
}

EXPORT int ftruncate64(int fd, off64_t length) {
    static void* slot;
    return forwardFtruncate(&slot, "ftruncate64", fd, length);
}

static int forwardTruncate(void** slot, const char* symbol, const char* path, off_t length) {
    const TruncateFn real = (TruncateFn)next(slot, symbol);
    const struct Target target = PATH_TARGET(path);
    if (decide("truncate", FAMILY_TRUNCATE, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const int result = real(path, length);
    if (result == 0 && watched) afterTruncate(&target, length);
    return result;
}

EXPORT int truncate(const char* path, off_t length) {
    static void* slot;
    return forwardTruncate(&slot, "truncate", path, length);
}

EXPORT int truncate64(const char* path, off64_t length) {
    static void* slot;
    return forwardTruncate(&slot, "truncate64", path, length);
}

EXPORT int utimensat(int dirfd, const char* path, const struct timespec times[2], int flags) {
    static void* slot;
    const UtimensatFn real = (UtimensatFn)next(&slot, "utimensat");
    const struct Target target = AT_TARGET(dirfd, path);
    if (decide("utimensat", FAMILY_UTIMENS, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const int result = real(dirfd, path, times, flags);
    if (result == 0 && watched) recordNamed("utimens", &target, flags & AT_SYMLINK_NOFOLLOW, 1);
    return result;
}

EXPORT int futimens(int fd, const struct timespec times[2]) {
    static void* slot;
    const FutimensFn real = (FutimensFn)next(&slot, "futimens");
    const struct Target target = FD_TARGET(fd);
    if (decide("futimens", FAMILY_UTIMENS, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const int result = real(fd, times);
    if (result == 0 && watched) recordNamed("utimens", &target, 0, 1);
    return result;
}

EXPORT int syncfs(int fd) {
    static void* slot;
    const FdFn real = (FdFn)next(&slot, "syncfs");
    if (decide("syncfs", FAMILY_SYNC, 1, FD_TARGET(fd)) == VERDICT_FAIL) return (int)writeResult(-1, 0);
    const int watched = watching(NULL);
    const int result = real(fd);
    if (result == 0 && watched) afterSyncfs();
    return (int)writeResult(result, 0);
}

/* fsync and fdatasync. */
static int forwardFsync(void** slot, const char* symbol, int fd) {
    const FdFn real = (FdFn)next(slot, symbol);
    const struct Target target = FD_TARGET(fd);
    if (decide(symbol, FAMILY_SYNC, 1, target) == VERDICT_FAIL) return (int)writeResult(-1, 0);
    const int watched = watching(&target);
    const int result = real(fd);
    if (result == 0 && watched) recordNamed("fsync", &target, 0, 0);
    return (int)writeResult(result, 0);
}

EXPORT int fsync(int fd) {
    static void* slot;
    return forwardFsync(&slot, "fsync", fd);
}

EXPORT int fdatasync(int fd) {
    static void* slot;
    return forwardFsync(&slot, "fdatasync", fd);
}

EXPORT int mkdir(const char* path, mode_t mode) {
    static void* slot;
    const PathModeFn real = (PathModeFn)next(&slot, "mkdir");
    const struct Target target = PATH_TARGET(path);
    if (decide("mkdir", FAMILY_MKDIR, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const int result = real(path, mode);
    if (result == 0 && watched) afterMkdir(&target);
    return result;
}

EXPORT int mkdirat(int dirfd, const char* path, mode_t mode) {
    static void* slot;
    const AtModeFn real = (AtModeFn)next(&slot, "mkdirat");
    const struct Target target = AT_TARGET(dirfd, path);
    if (decide("mkdirat", FAMILY_MKDIR, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const int result = real(dirfd, path, mode);
    if (result == 0 && watched) afterMkdir(&target);
    return result;
}

EXPORT int chmod(const char* path, mode_t mode) {
    static void* slot;
    const PathModeFn real = (PathModeFn)next(&slot, "chmod");
    const struct Target target = PATH_TARGET(path);
    if (decide("chmod", FAMILY_CHMOD, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const int result = real(path, mode);
    if (result == 0 && watched) recordNamed("chmod", &target, 0, 0);
    return result;
}

EXPORT int fchmod(int fd, mode_t mode) {
    static void* slot;
    const FdModeFn real = (FdModeFn)next(&slot, "fchmod");
    const struct Target target = FD_TARGET(fd);
    if (decide("fchmod", FAMILY_CHMOD, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const int result = real(fd, mode);
    if (result == 0 && watched) recordNamed("chmod", &target, 0, 0);
    return result;
}

EXPORT int fchmodat(int dirfd, const char* path, mode_t mode, int flags) {
    static void* slot;
    const FchmodatFn real = (FchmodatFn)next(&slot, "fchmodat");
    const struct Target target = AT_TARGET(dirfd, path);
    if (decide("fchmodat", FAMILY_CHMOD, 1, target) == VERDICT_FAIL) return -1;
    const int watched = watching(&target);
    const int result = real(dirfd, path, mode, flags);
    if (result == 0 && watched) recordNamed("chmod", &target, flags & AT_SYMLINK_NOFOLLOW, 0);
    return result;
}

/* ---- locks ---- */

typedef int (*FlockFn)(int, int);

EXPORT int flock(int fd, int operation) {
    static void* slot;
    const FlockFn real = (FlockFn)next(&slot, "flock");
    const int saved = errno;
    const int off = enabled() && config.locksOff;
    errno = saved;
    return off ? 0 : real(fd, operation);
}
