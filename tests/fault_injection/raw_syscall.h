/*
 * The shim's own system calls, made without libc: the shim interposes
 * syscall() itself (for openat2, which glibc does not wrap), and its own
 * calls must never be counted, recorded or failed. Returns the result, or
 * -1 with errno set, as syscall() does.
 */
#pragma once

#include <errno.h>

static inline long rawSyscall6(long number, long a, long b, long c, long d, long e, long f) {
    long result;
#if defined(__x86_64__)
    register long r10 __asm__("r10") = d;
    register long r8 __asm__("r8") = e;
    register long r9 __asm__("r9") = f;
    __asm__ volatile("syscall"
                     : "=a"(result)
                     : "a"(number), "D"(a), "S"(b), "d"(c), "r"(r10), "r"(r8), "r"(r9)
                     : "rcx", "r11", "memory");
#elif defined(__aarch64__)
    register long x8 __asm__("x8") = number;
    register long x0 __asm__("x0") = a;
    register long x1 __asm__("x1") = b;
    register long x2 __asm__("x2") = c;
    register long x3 __asm__("x3") = d;
    register long x4 __asm__("x4") = e;
    register long x5 __asm__("x5") = f;
    __asm__ volatile("svc 0" : "+r"(x0) : "r"(x8), "r"(x1), "r"(x2), "r"(x3), "r"(x4), "r"(x5) : "memory");
    result = x0;
#else
#error "raw system calls are written for x86-64 and ARM64 only"
#endif
    if (result < 0 && result > -4096) {
        errno = (int)-result;
        return -1;
    }
    return result;
}

/* Up to six arguments, as for syscall(); missing ones are passed as 0. */
#define RAW_SYSCALL_PICK(n, a, b, c, d, e, f, ...) \
    rawSyscall6((long)(n), (long)(a), (long)(b), (long)(c), (long)(d), (long)(e), (long)(f))
#define rawSyscall(...) RAW_SYSCALL_PICK(__VA_ARGS__, 0, 0, 0, 0, 0, 0, 0)
