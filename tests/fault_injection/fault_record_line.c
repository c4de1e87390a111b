#define _GNU_SOURCE

#include "fault_record_line.h"
#include "raw_syscall.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <unistd.h>

/* The kind, the spaces and every number field of the longest line. */
enum { kFixedBytes = 160 };

void* recordMap(size_t size) {
    const long memory =
        rawSyscall(SYS_mmap, NULL, size == 0 ? 1 : size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    return memory == -1 ? NULL : (void*)memory;
}

void recordUnmap(void* memory, size_t size) { rawSyscall(SYS_munmap, memory, size == 0 ? 1 : size); }

static void put(struct RecordLine* line, const char* text, size_t length) {
    if (line->overflowed || line->capacity - line->length < length) {
        line->overflowed = 1;
        return;
    }
    memcpy(line->text + line->length, text, length);
    line->length += length;
}

int recordLineBegin(struct RecordLine* line, const char* kind, size_t pathBytes, size_t dataBytes) {
    line->capacity = kFixedBytes + 3 * pathBytes + 2 * dataBytes;
    line->length = 0;
    line->overflowed = 0;
    line->text = recordMap(line->capacity);
    if (line->text == NULL) return 0;
    put(line, kind, strlen(kind));
    return 1;
}

void recordLinePath(struct RecordLine* line, const char* path) {
    put(line, " ", 1);
    for (; *path != '\0'; ++path) {
        switch (*path) {
            case '%':
                put(line, "%25", 3);
                break;
            case ' ':
                put(line, "%20", 3);
                break;
            case '\n':
                put(line, "%0A", 3);
                break;
            default:
                put(line, path, 1);
        }
    }
}

static void putDigits(struct RecordLine* line, unsigned long long value, size_t minimumDigits) {
    char digits[24];
    size_t count = 0;
    do {
        digits[count++] = (char)('0' + value % 10);
        value /= 10;
    } while (value != 0 || count < minimumDigits);
    while (count > 0) put(line, &digits[--count], 1);
}

void recordLineUnsigned(struct RecordLine* line, unsigned long long value) {
    put(line, " ", 1);
    putDigits(line, value, 1);
}

void recordLineSigned(struct RecordLine* line, long long value) {
    put(line, " ", 1);
    if (value < 0) put(line, "-", 1);
    putDigits(line, value < 0 ? 0ULL - (unsigned long long)value : (unsigned long long)value, 1);
}

void recordLineTime(struct RecordLine* line, const struct timespec* time) {
    recordLineSigned(line, (long long)time->tv_sec);
    put(line, ".", 1);
    putDigits(line, (unsigned long long)time->tv_nsec, 9);
}

void recordLineHex(struct RecordLine* line, const struct iovec* buffers, int bufferCount, size_t count) {
    static const char kDigits[] = "0123456789abcdef";
    put(line, " ", 1);
    if (count == 0) put(line, "-", 1);
    for (int i = 0; i < bufferCount && count > 0; ++i) {
        const unsigned char* bytes = buffers[i].iov_base;
        const size_t length = buffers[i].iov_len < count ? buffers[i].iov_len : count;
        for (size_t j = 0; j < length; ++j) {
            const char pair[2] = {kDigits[bytes[j] >> 4], kDigits[bytes[j] & 0xF]};
            put(line, pair, 2);
        }
        count -= length;
    }
}

void recordLineUnknown(struct RecordLine* line) { put(line, " ?", 2); }

int recordLineAppend(struct RecordLine* line, const char* file) {
    put(line, "\n", 1);
    int written = 0;
    if (!line->overflowed) {
        const long fd = rawSyscall(SYS_openat, AT_FDCWD, file, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666);
        if (fd >= 0) {
            long done;
            do {
                done = rawSyscall(SYS_write, fd, line->text, line->length);
            } while (done < 0 && errno == EINTR);
            written = done == (long)line->length;
            rawSyscall(SYS_close, fd);
        }
    }
    recordUnmap(line->text, line->capacity);
    return written;
}
