/*
 * One line of the shim's record (see FAULT_RECORD in fault_injection_shim.c):
 * words separated by one space, built in an anonymous mapping and appended
 * to the record with one write. Raw system calls only, no allocation and no
 * stdio, like the rest of the shim.
 */
#pragma once

#include <stddef.h>
#include <sys/uio.h>
#include <time.h>

struct RecordLine {
    char* text;
    size_t length;
    size_t capacity;
    int overflowed;
};

/* Maps room for `kind` and the fields that follow: paths of
 * `pathBytes` bytes in all and `dataBytes` bytes of hex. Returns 0 when
 * no memory can be mapped. */
int recordLineBegin(struct RecordLine* line, const char* kind, size_t pathBytes, size_t dataBytes);

/* The next field: a path with '%', ' ' and '\n' escaped as %25, %20, %0A. */
void recordLinePath(struct RecordLine* line, const char* path);

void recordLineUnsigned(struct RecordLine* line, unsigned long long value);
void recordLineSigned(struct RecordLine* line, long long value);

/* SEC.NNNNNNNNN: the nanoseconds always nine digits. */
void recordLineTime(struct RecordLine* line, const struct timespec* time);

/* The first `count` bytes held by the buffers, as lowercase hex; "-" for
 * none. */
void recordLineHex(struct RecordLine* line, const struct iovec* buffers, int bufferCount, size_t count);

/* "?": bytes that could not be read back. */
void recordLineUnknown(struct RecordLine* line);

/* Ends the line, appends it to `file` (opened O_APPEND) and unmaps it.
 * Returns 0 when the line did not fit or could not be written whole. */
int recordLineAppend(struct RecordLine* line, const char* file);

/* Anonymous memory for bytes read back; NULL on failure. */
void* recordMap(size_t size);
void recordUnmap(void* memory, size_t size);
