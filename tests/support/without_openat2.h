// Running code as on a kernel, or under an emulator, that has no openat2,
// so that the fallback the store uses there is tested on any host.
#pragma once

namespace testing_support {

// Whether this process can use openat2: not under an emulator (or on a
// kernel) without it.
bool openat2Available();

// From now on openat2 fails with ENOSYS in this process and in every
// process it starts (a seccomp filter; call it in a child). False when that
// cannot be arranged while openat2 still works.
bool withoutOpenat2();

}  // namespace testing_support
