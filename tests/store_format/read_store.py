#!/usr/bin/env python3
"""A reader of the dual-file stores written from docs/STORE_FORMAT.md alone.

    read_store.py TARGET_DIRECTORY SLOTS   prints what each slot serves,
                                           a line each, after its index:
        present COPY SIZE CRC32    the current copy (1 or 2) and its blob
        absent-blob COPY           an erased slot
        none                       no valid copy

It shares nothing with the product: a second reading of the format, so
that the document, and not only the code, says how to read a store.
"""
import os
import stat
import struct
import sys
import zlib

ABSENT = 0xFFFFFFFFFFFFFFFF


def regular(path):
    """The lstat of a regular file at `path`, or None (missing, a link,
    anything else)."""
    try:
        status = os.lstat(path)
    except OSError:
        return None
    return status if stat.S_ISREG(status.st_mode) else None


def directory_reached(path, top):
    """Every component from `top` down to `path` is a real directory."""
    relative = os.path.relpath(path, top)
    current = top
    for part in relative.split(os.sep):
        if part == '.':
            continue
        current = os.path.join(current, part)
        try:
            if not stat.S_ISDIR(os.lstat(current).st_mode):
                return False
        except OSError:
            return False
    return True


def judge(slot, name):
    """(valid, check time in ns or None, data bytes or None) of one copy."""
    copy = os.path.join(slot, name)
    if not directory_reached(copy, slot):
        return False, None, None
    check_status = regular(os.path.join(copy, 'data.chk'))
    if check_status is None or check_status.st_size != 8:
        return False, None, None
    try:
        with open(os.path.join(copy, 'data.chk'), 'rb') as check:
            stored = struct.unpack('<Q', check.read(8))[0]
    except (OSError, struct.error):
        return False, None, None
    time = check_status.st_mtime_ns
    data_status = regular(os.path.join(copy, 'data'))
    if stored == ABSENT and data_status is None and not os.path.lexists(os.path.join(copy, 'data')):
        return True, time, None
    if data_status is None or data_status.st_size & 0xFFFFFFFF != stored & 0xFFFFFFFF:
        return False, None, None
    try:
        with open(os.path.join(copy, 'data'), 'rb') as data:
            blob = data.read()
    except OSError:
        return False, None, None
    value = len(blob) | (zlib.crc32(blob) << 32)
    return (value == stored), time, (blob if value == stored else None)


def read_slot(target, slots, index):
    slot = target if slots == 1 else os.path.join(target, str(index))
    if not directory_reached(slot, target):
        return 'none'
    copies = [judge(slot, '1'), judge(slot, '2')]
    (valid0, time0, _), (valid1, time1, _) = copies
    earlier = time0 if valid0 and time0 is not None else None
    current = 1 if valid1 and time1 is not None and (earlier is None or time1 > earlier) else 0
    valid, _, blob = copies[current]
    if not valid:
        return 'none'
    if blob is None:
        return 'absent-blob %d' % (current + 1)
    return 'present %d %d 0x%08x' % (current + 1, len(blob), zlib.crc32(blob))


if __name__ == '__main__':
    if len(sys.argv) != 3:
        sys.exit('usage: read_store.py TARGET_DIRECTORY SLOTS')
    slots = int(sys.argv[2])
    for index in range(slots):
        print(index, read_slot(sys.argv[1], slots, index))
