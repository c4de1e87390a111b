/*
 * LD_PRELOAD shim that fails or ends the process at the Nth matching file
 * system call, so tests can reach failure paths and simulate power cuts
 * without any test code in the product. Configured by environment variables,
 * read once; without FAULT_CALL it only forwards.
 *
 *   FAULT_CALL         what to count: a call family, an exact function name,
 *                      or "mutating".
 *                        open      open, openat, creat, fopen, read-only
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
 *                        mutating  every call above except opens that
 *                                  neither write, create nor truncate
 *                      A family name wins over the function of the same
 *                      name. The 64-bit and fortified variants (open64,
 *                      __open_2, pwrite64, ...) count as their base name.
 *   FAULT_NTH          1-based number of the one matching call to act on;
 *                      later calls are made normally. Without it calls are
 *                      only counted.
 *   FAULT_ACTION       required with FAULT_NTH:
 *                        errno:NAME or errno:NUMBER  the call is not made
 *                          and fails with that errno (NULL for fopen)
 *                        crash  the call is not made and the process is
 *                          killed with SIGKILL: no exit handlers, no stdio
 *                          flushing
 *                        short:BYTES  write and pwrite transfer at most
 *                          BYTES; any other call is made unchanged
 *   FAULT_PATH_SUBSTR  only calls whose file's path contains this text are
 *                      counted. Path arguments are matched as given (a
 *                      relative path after an *at call's directory is also
 *                      matched joined to that directory's path); a call
 *                      that takes only a descriptor is matched on the path
 *                      the kernel shows for it in /proc/self/fd. rename
 *                      matches on either name.
 *   FAULT_COUNT_FILE   receives the number of matching calls seen, in
 *                      decimal with a newline: 0 at load, then rewritten
 *                      after every matching call (before a crash too), so
 *                      it is right however the process ends. Give an
 *                      absolute path.
 *
 * The shim acts only in the process that loaded it: it removes the FAULT_*
 * variables from the environment at load, so programs that process starts
 * run unaffected, and a forked child passes every call through. A bad
 * setting ends the process at load with status 98 and a message on
 * standard error.
 *
 * The shim neither allocates nor uses stdio, and its own I/O goes through
 * raw system calls: it may run inside the start-up of any process, before
 * the program's allocator or its sanitizer runtime is ready, and its own
 * calls are never counted.
 */
#define _GNU_SOURCE
#undef _FORTIFY_SOURCE

#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
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
    FAMILY_COUNT
};

static const char* const kFamilyNames[FAMILY_COUNT] = {
    "open", "write", "pwrite", "copy", "rename", "unlink", "truncate", "utimens", "sync", "mkdir", "chmod",
};

struct Function {
    const char* name;
    enum Family family;
};

static const struct Function kFunctions[] = {
    {"open", FAMILY_OPEN},         {"openat", FAMILY_OPEN},
    {"creat", FAMILY_OPEN},        {"fopen", FAMILY_OPEN},
    {"write", FAMILY_WRITE},       {"writev", FAMILY_WRITE},
    {"pwrite", FAMILY_PWRITE},     {"pwritev", FAMILY_PWRITE},
    {"sendfile", FAMILY_COPY},     {"copy_file_range", FAMILY_COPY},
    {"rename", FAMILY_RENAME},     {"renameat", FAMILY_RENAME},
    {"renameat2", FAMILY_RENAME},  {"unlink", FAMILY_UNLINK},
    {"unlinkat", FAMILY_UNLINK},   {"remove", FAMILY_UNLINK},
    {"rmdir", FAMILY_UNLINK},      {"ftruncate", FAMILY_TRUNCATE},
    {"truncate", FAMILY_TRUNCATE}, {"utimensat", FAMILY_UTIMENS},
    {"futimens", FAMILY_UTIMENS},  {"syncfs", FAMILY_SYNC},
    {"fsync", FAMILY_SYNC},        {"fdatasync", FAMILY_SYNC},
    {"mkdir", FAMILY_MKDIR},       {"mkdirat", FAMILY_MKDIR},
    {"chmod", FAMILY_CHMOD},       {"fchmod", FAMILY_CHMOD},
    {"fchmodat", FAMILY_CHMOD},
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

enum Action { ACTION_NONE, ACTION_ERRNO, ACTION_CRASH, ACTION_SHORT };

enum Verdict { VERDICT_PROCEED, VERDICT_FAIL, VERDICT_SHORT };

static struct {
    int active;
    int allMutating;
    int family;           /* -1: match by function name */
    const char* function; /* static name from kFunctions */
    unsigned long nth;    /* 0: count only */
    enum Action action;
    int error;
    size_t shortLength;
    int hasPathSubstr;
    char pathSubstr[PATH_MAX];
    int hasCountFile;
    char countFile[PATH_MAX];
    pid_t pid;
} config;

enum { STATE_NEW, STATE_LOADING, STATE_READY };
static int state = STATE_NEW;
static unsigned long seen;

/* ---- raw output, no libc buffering or allocation ---- */

static void rawWrite(int fd, const char* text, size_t length) {
    while (length > 0) {
        const long done = syscall(SYS_write, fd, text, length);
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
    const long fd = syscall(SYS_openat, AT_FDCWD, config.countFile, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
    if (fd < 0) return 0;
    char text[24];
    const size_t length = formatDecimal(count, text);
    text[length] = '\n';
    rawWrite((int)fd, text, length + 1);
    syscall(SYS_close, fd);
    return 1;
}

__attribute__((noreturn)) static void crashNow(void) {
    syscall(SYS_kill, syscall(SYS_getpid), SIGKILL);
    for (;;) syscall(SYS_exit_group, 99);
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
    for (;;) syscall(SYS_exit_group, 98);
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
        configError("FAULT_ACTION", value, "expected errno:NAME, errno:NUMBER, crash or short:BYTES");
    }
}

static const char* setting(const char* name) {
    const char* value = getenv(name);
    return value != NULL && *value != '\0' ? value : NULL;
}

static void loadConfig(void) {
    const char* call = setting("FAULT_CALL");
    const char* nth = setting("FAULT_NTH");
    const char* action = setting("FAULT_ACTION");
    const char* pathSubstr = setting("FAULT_PATH_SUBSTR");
    const char* countFile = setting("FAULT_COUNT_FILE");

    if (call == NULL) {
        if (nth != NULL || action != NULL || pathSubstr != NULL || countFile != NULL) {
            configError("FAULT_CALL", NULL, "missing, but other FAULT_ variables are set");
        }
        return;
    }
    config.family = -1;
    parseCall(call);
    if (nth != NULL && (!parseUnsigned(nth, &config.nth) || config.nth == 0)) {
        configError("FAULT_NTH", nth, "expected a number from 1");
    }
    if (nth != NULL && action == NULL) configError("FAULT_ACTION", NULL, "missing, but FAULT_NTH is set");
    if (nth == NULL && action != NULL) configError("FAULT_NTH", NULL, "missing, but FAULT_ACTION is set");
    if (action != NULL) parseAction(action);
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
    config.pid = (pid_t)syscall(SYS_getpid);
    config.active = 1;

    /* Programs this process starts must not inherit the fault. */
    unsetenv("FAULT_CALL");
    unsetenv("FAULT_NTH");
    unsetenv("FAULT_ACTION");
    unsetenv("FAULT_PATH_SUBSTR");
    unsetenv("FAULT_COUNT_FILE");
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
    return current == STATE_READY && config.active && (pid_t)syscall(SYS_getpid) == config.pid;
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
    const long length = syscall(SYS_readlinkat, AT_FDCWD, link, out, capacity - 1);
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
    if (!enabled() || !callMatches(function, family, mutating) || (config.hasPathSubstr && !targetMatches(&target))) {
        errno = saved;
        return VERDICT_PROCEED;
    }
    const unsigned long count = __atomic_add_fetch(&seen, 1, __ATOMIC_ACQ_REL);
    (void)writeCountFile(count); /* checked at load */
    errno = saved;
    if (count != config.nth) return VERDICT_PROCEED;
    switch (config.action) {
        case ACTION_CRASH:
            crashNow();
        case ACTION_ERRNO:
            errno = config.error;
            return VERDICT_FAIL;
        case ACTION_SHORT:
            return VERDICT_SHORT;
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

static int openNeedsMode(int flags) {
    return (flags & O_CREAT) != 0 || (flags & O_TMPFILE) == O_TMPFILE;
}

static size_t shortened(size_t count) {
    return count < config.shortLength ? count : config.shortLength;
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
    if (decide("open", FAMILY_OPEN, openMutates(flags), PATH_TARGET(path)) == VERDICT_FAIL) return -1;
    return real(path, flags, mode);
}

static int forwardOpenat(void** slot, const char* symbol, int dirfd, const char* path, int flags, mode_t mode) {
    const OpenatFn real = (OpenatFn)next(slot, symbol);
    if (decide("openat", FAMILY_OPEN, openMutates(flags), AT_TARGET(dirfd, path)) == VERDICT_FAIL) return -1;
    return real(dirfd, path, flags, mode);
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
    if (decide("open", FAMILY_OPEN, openMutates(flags), PATH_TARGET(path)) == VERDICT_FAIL) return -1;
    return real(path, flags);
}

static int forwardOpenat2(void** slot, const char* symbol, int dirfd, const char* path, int flags) {
    const Openat2Fn real = (Openat2Fn)next(slot, symbol);
    if (decide("openat", FAMILY_OPEN, openMutates(flags), AT_TARGET(dirfd, path)) == VERDICT_FAIL) return -1;
    return real(dirfd, path, flags);
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
    if (decide("creat", FAMILY_OPEN, 1, PATH_TARGET(path)) == VERDICT_FAIL) return -1;
    return real(path, mode);
}

EXPORT int creat(const char* path, mode_t mode) {
    static void* slot;
    return forwardCreat(&slot, "creat", path, mode);
}

EXPORT int creat64(const char* path, mode_t mode) {
    static void* slot;
    return forwardCreat(&slot, "creat64", path, mode);
}

/* glibc's stdio opens through internal calls the shim cannot see. */
static FILE* forwardFopen(void** slot, const char* symbol, const char* path, const char* mode) {
    const FopenFn real = (FopenFn)next(slot, symbol);
    if (decide("fopen", FAMILY_OPEN, strpbrk(mode, "wa+") != NULL, PATH_TARGET(path)) == VERDICT_FAIL) return NULL;
    return real(path, mode);
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
typedef ssize_t (*Pwrite64Fn)(int, const void*, size_t, off64_t);
typedef ssize_t (*PwritevFn)(int, const struct iovec*, int, off_t);
typedef ssize_t (*Pwritev64Fn)(int, const struct iovec*, int, off64_t);
typedef ssize_t (*SendfileFn)(int, int, off_t*, size_t);
typedef ssize_t (*Sendfile64Fn)(int, int, off64_t*, size_t);
typedef ssize_t (*CopyFileRangeFn)(int, loff_t*, int, loff_t*, size_t, unsigned int);

EXPORT ssize_t write(int fd, const void* data, size_t count) {
    static void* slot;
    const WriteFn real = (WriteFn)next(&slot, "write");
    switch (decide("write", FAMILY_WRITE, 1, FD_TARGET(fd))) {
        case VERDICT_FAIL:
            return -1;
        case VERDICT_SHORT:
            return real(fd, data, shortened(count));
        case VERDICT_PROCEED:
            break;
    }
    return real(fd, data, count);
}

EXPORT ssize_t writev(int fd, const struct iovec* vector, int count) {
    static void* slot;
    const WritevFn real = (WritevFn)next(&slot, "writev");
    if (decide("writev", FAMILY_WRITE, 1, FD_TARGET(fd)) == VERDICT_FAIL) return -1;
    return real(fd, vector, count);
}

EXPORT ssize_t pwrite(int fd, const void* data, size_t count, off_t offset) {
    static void* slot;
    const PwriteFn real = (PwriteFn)next(&slot, "pwrite");
    switch (decide("pwrite", FAMILY_PWRITE, 1, FD_TARGET(fd))) {
        case VERDICT_FAIL:
            return -1;
        case VERDICT_SHORT:
            return real(fd, data, shortened(count), offset);
        case VERDICT_PROCEED:
            break;
    }
    return real(fd, data, count, offset);
}

EXPORT ssize_t pwrite64(int fd, const void* data, size_t count, off64_t offset) {
    static void* slot;
    const Pwrite64Fn real = (Pwrite64Fn)next(&slot, "pwrite64");
    switch (decide("pwrite", FAMILY_PWRITE, 1, FD_TARGET(fd))) {
        case VERDICT_FAIL:
            return -1;
        case VERDICT_SHORT:
            return real(fd, data, shortened(count), offset);
        case VERDICT_PROCEED:
            break;
    }
    return real(fd, data, count, offset);
}

EXPORT ssize_t pwritev(int fd, const struct iovec* vector, int count, off_t offset) {
    static void* slot;
    const PwritevFn real = (PwritevFn)next(&slot, "pwritev");
    if (decide("pwritev", FAMILY_PWRITE, 1, FD_TARGET(fd)) == VERDICT_FAIL) return -1;
    return real(fd, vector, count, offset);
}

EXPORT ssize_t pwritev64(int fd, const struct iovec* vector, int count, off64_t offset) {
    static void* slot;
    const Pwritev64Fn real = (Pwritev64Fn)next(&slot, "pwritev64");
    if (decide("pwritev", FAMILY_PWRITE, 1, FD_TARGET(fd)) == VERDICT_FAIL) return -1;
    return real(fd, vector, count, offset);
}

EXPORT ssize_t sendfile(int outFd, int inFd, off_t* offset, size_t count) {
    static void* slot;
    const SendfileFn real = (SendfileFn)next(&slot, "sendfile");
    if (decide("sendfile", FAMILY_COPY, 1, FD_TARGET(outFd)) == VERDICT_FAIL) return -1;
    return real(outFd, inFd, offset, count);
}

EXPORT ssize_t sendfile64(int outFd, int inFd, off64_t* offset, size_t count) {
    static void* slot;
    const Sendfile64Fn real = (Sendfile64Fn)next(&slot, "sendfile64");
    if (decide("sendfile", FAMILY_COPY, 1, FD_TARGET(outFd)) == VERDICT_FAIL) return -1;
    return real(outFd, inFd, offset, count);
}

EXPORT ssize_t copy_file_range(int inFd, loff_t* inOffset, int outFd, loff_t* outOffset, size_t count,
                               unsigned int flags) {
    static void* slot;
    const CopyFileRangeFn real = (CopyFileRangeFn)next(&slot, "copy_file_range");
    if (decide("copy_file_range", FAMILY_COPY, 1, FD_TARGET(outFd)) == VERDICT_FAIL) return -1;
    return real(inFd, inOffset, outFd, outOffset, count, flags);
}

/* ---- rename and removal ---- */

typedef int (*RenameFn)(const char*, const char*);
typedef int (*RenameatFn)(int, const char*, int, const char*);
typedef int (*Renameat2Fn)(int, const char*, int, const char*, unsigned int);
typedef int (*PathFn)(const char*);
typedef int (*UnlinkatFn)(int, const char*, int);

EXPORT int rename(const char* from, const char* to) {
    static void* slot;
    const RenameFn real = (RenameFn)next(&slot, "rename");
    const struct Target target = {AT_FDCWD, from, AT_FDCWD, to, -1};
    if (decide("rename", FAMILY_RENAME, 1, target) == VERDICT_FAIL) return -1;
    return real(from, to);
}

EXPORT int renameat(int fromDir, const char* from, int toDir, const char* to) {
    static void* slot;
    const RenameatFn real = (RenameatFn)next(&slot, "renameat");
    const struct Target target = {fromDir, from, toDir, to, -1};
    if (decide("renameat", FAMILY_RENAME, 1, target) == VERDICT_FAIL) return -1;
    return real(fromDir, from, toDir, to);
}

EXPORT int renameat2(int fromDir, const char* from, int toDir, const char* to, unsigned int flags) {
    static void* slot;
    const Renameat2Fn real = (Renameat2Fn)next(&slot, "renameat2");
    const struct Target target = {fromDir, from, toDir, to, -1};
    if (decide("renameat2", FAMILY_RENAME, 1, target) == VERDICT_FAIL) return -1;
    return real(fromDir, from, toDir, to, flags);
}

static int forwardPathCall(void** slot, const char* symbol, enum Family family, const char* path) {
    const PathFn real = (PathFn)next(slot, symbol);
    if (decide(symbol, family, 1, PATH_TARGET(path)) == VERDICT_FAIL) return -1;
    return real(path);
}

EXPORT int unlink(const char* path) {
    static void* slot;
    return forwardPathCall(&slot, "unlink", FAMILY_UNLINK, path);
}

/* remove() reaches unlink or rmdir inside glibc, so it is counted once. */
EXPORT int remove(const char* path) {
    static void* slot;
    return forwardPathCall(&slot, "remove", FAMILY_UNLINK, path);
}

EXPORT int rmdir(const char* path) {
    static void* slot;
    return forwardPathCall(&slot, "rmdir", FAMILY_UNLINK, path);
}

EXPORT int unlinkat(int dirfd, const char* path, int flags) {
    static void* slot;
    const UnlinkatFn real = (UnlinkatFn)next(&slot, "unlinkat");
    if (decide("unlinkat", FAMILY_UNLINK, 1, AT_TARGET(dirfd, path)) == VERDICT_FAIL) return -1;
    return real(dirfd, path, flags);
}

/* ---- size, times, syncing, directories, modes ---- */

typedef int (*FtruncateFn)(int, off_t);
typedef int (*Ftruncate64Fn)(int, off64_t);
typedef int (*TruncateFn)(const char*, off_t);
typedef int (*Truncate64Fn)(const char*, off64_t);
typedef int (*UtimensatFn)(int, const char*, const struct timespec*, int);
typedef int (*FutimensFn)(int, const struct timespec*);
typedef int (*FdFn)(int);
typedef int (*PathModeFn)(const char*, mode_t);
typedef int (*FdModeFn)(int, mode_t);
typedef int (*AtModeFn)(int, const char*, mode_t);
typedef int (*FchmodatFn)(int, const char*, mode_t, int);

EXPORT int ftruncate(int fd, off_t length) {
    static void* slot;
    const FtruncateFn real = (FtruncateFn)next(&slot, "ftruncate");
    if (decide("ftruncate", FAMILY_TRUNCATE, 1, FD_TARGET(fd)) == VERDICT_FAIL) return -1;
    return real(fd, length);
}

EXPORT int ftruncate64(int fd, off64_t length) {
    static void* slot;
    const Ftruncate64Fn real = (Ftruncate64Fn)next(&slot, "ftruncate64");
    if (decide("ftruncate", FAMILY_TRUNCATE, 1, FD_TARGET(fd)) == VERDICT_FAIL) return -1;
    return real(fd, length);
}

EXPORT int truncate(const char* path, off_t length) {
    static void* slot;
    const TruncateFn real = (TruncateFn)next(&slot, "truncate");
    if (decide("truncate", FAMILY_TRUNCATE, 1, PATH_TARGET(path)) == VERDICT_FAIL) return -1;
    return real(path, length);
}

EXPORT int truncate64(const char* path, off64_t length) {
    static void* slot;
    const Truncate64Fn real = (Truncate64Fn)next(&slot, "truncate64");
    if (decide("truncate", FAMILY_TRUNCATE, 1, PATH_TARGET(path)) == VERDICT_FAIL) return -1;
    return real(path, length);
}

EXPORT int utimensat(int dirfd, const char* path, const struct timespec times[2], int flags) {
    static void* slot;
    const UtimensatFn real = (UtimensatFn)next(&slot, "utimensat");
    if (decide("utimensat", FAMILY_UTIMENS, 1, AT_TARGET(dirfd, path)) == VERDICT_FAIL) return -1;
    return real(dirfd, path, times, flags);
}

EXPORT int futimens(int fd, const struct timespec times[2]) {
    static void* slot;
    const FutimensFn real = (FutimensFn)next(&slot, "futimens");
    if (decide("futimens", FAMILY_UTIMENS, 1, FD_TARGET(fd)) == VERDICT_FAIL) return -1;
    return real(fd, times);
}

static int forwardFdCall(void** slot, const char* symbol, enum Family family, int fd) {
    const FdFn real = (FdFn)next(slot, symbol);
    if (decide(symbol, family, 1, FD_TARGET(fd)) == VERDICT_FAIL) return -1;
    return real(fd);
}

EXPORT int syncfs(int fd) {
    static void* slot;
    return forwardFdCall(&slot, "syncfs", FAMILY_SYNC, fd);
}

EXPORT int fsync(int fd) {
    static void* slot;
    return forwardFdCall(&slot, "fsync", FAMILY_SYNC, fd);
}

EXPORT int fdatasync(int fd) {
    static void* slot;
    return forwardFdCall(&slot, "fdatasync", FAMILY_SYNC, fd);
}

EXPORT int mkdir(const char* path, mode_t mode) {
    static void* slot;
    const PathModeFn real = (PathModeFn)next(&slot, "mkdir");
    if (decide("mkdir", FAMILY_MKDIR, 1, PATH_TARGET(path)) == VERDICT_FAIL) return -1;
    return real(path, mode);
}

EXPORT int mkdirat(int dirfd, const char* path, mode_t mode) {
    static void* slot;
    const AtModeFn real = (AtModeFn)next(&slot, "mkdirat");
    if (decide("mkdirat", FAMILY_MKDIR, 1, AT_TARGET(dirfd, path)) == VERDICT_FAIL) return -1;
    return real(dirfd, path, mode);
}

EXPORT int chmod(const char* path, mode_t mode) {
    static void* slot;
    const PathModeFn real = (PathModeFn)next(&slot, "chmod");
    if (decide("chmod", FAMILY_CHMOD, 1, PATH_TARGET(path)) == VERDICT_FAIL) return -1;
    return real(path, mode);
}

EXPORT int fchmod(int fd, mode_t mode) {
    static void* slot;
    const FdModeFn real = (FdModeFn)next(&slot, "fchmod");
    if (decide("fchmod", FAMILY_CHMOD, 1, FD_TARGET(fd)) == VERDICT_FAIL) return -1;
    return real(fd, mode);
}

EXPORT int fchmodat(int dirfd, const char* path, mode_t mode, int flags) {
    static void* slot;
    const FchmodatFn real = (FchmodatFn)next(&slot, "fchmodat");
    if (decide("fchmodat", FAMILY_CHMOD, 1, AT_TARGET(dirfd, path)) == VERDICT_FAIL) return -1;
    return real(dirfd, path, mode, flags);
}
