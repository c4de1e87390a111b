#!/usr/bin/env python3
"""read_store.py, written from docs/STORE_FORMAT.md alone, agrees with
inspect_store on every slot of stores that the tool and the store driver
populated and that were then damaged at random as a power cut, a failing
card or less trusted code might leave them.

    reader_agrees_test.py MIGRATE_SETTINGS INSPECT_STORE DUAL_FILE_DRIVER
"""
import os
import random
import sys
import tempfile

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, HERE)
import read_store  # noqa: E402
from inspect_answers import answers, run  # noqa: E402

TARGETS = [('settings', 'settings', 1), ('overlay', 'app/overlays', 8), ('lut', 'app/luts', 26)]
ROUNDS = 12


def populate(tools, base, rng, work):
    migrate, _, driver = tools
    for name, location, slots in TARGETS:
        for index in rng.sample(range(slots), min(slots, 3)):
            for _ in range(rng.choice([1, 1, 2, 3])):
                blob = os.path.join(work, 'blob')
                with open(blob, 'wb') as out:
                    out.write(rng.randbytes(rng.choice([0, 1, 100, 5000, 70000])))
                run(migrate, '--base', base, '--target', name, '--index', str(index), '--type', 'simple',
                    '--data', blob)
            if rng.random() < 0.3:
                run(driver, os.path.join(base, location), str(slots), str(index), 'erase')


def damage(slot, rng):
    copy = os.path.join(slot, rng.choice(['1', '2']))
    data, check = os.path.join(copy, 'data'), os.path.join(copy, 'data.chk')
    kind = rng.choice(['flip', 'truncate', 'no-check', 'check-9', 'equal-times', 'older', 'tmp', 'data-dir',
                       'copy-link', 'check-link', 'no-data'])
    try:
        if kind == 'flip' and os.path.getsize(data) > 0:
            with open(data, 'r+b') as f:
                f.seek(rng.randrange(os.path.getsize(data)))
                byte = f.read(1)
                f.seek(-1, 1)
                f.write(bytes([byte[0] ^ 0x10]))
        elif kind == 'truncate':
            os.truncate(data, os.path.getsize(data) // 2)
        elif kind == 'no-check':
            os.remove(check)
        elif kind == 'check-9':
            with open(check, 'ab') as f:
                f.write(b'\0')
        elif kind == 'equal-times':
            other = os.path.join(slot, '1' if copy.endswith('2') else '2', 'data.chk')
            stamp = os.stat(other).st_mtime_ns
            os.utime(check, ns=(stamp, stamp))
        elif kind == 'older':
            stamp = os.stat(check).st_mtime_ns - 10**10
            os.utime(check, ns=(stamp, stamp))
        elif kind == 'tmp':
            with open(check + '.tmp', 'wb') as f:
                f.write(b'\1\2\3')
        elif kind == 'data-dir':
            os.remove(data)
            os.mkdir(data)
        elif kind == 'copy-link':
            os.rename(copy, copy + '.real')
            os.symlink(os.path.basename(copy) + '.real', copy)
        elif kind == 'check-link':
            os.rename(check, check + '.real')
            os.symlink('data.chk.real', check)
        elif kind == 'no-data':
            os.remove(data)
    except OSError:
        pass  # the file it would damage is not there: nothing to do
    return kind


def main():
    tools = sys.argv[1:4]
    compared = disagreements = 0
    for seed in range(ROUNDS):
        rng = random.Random(seed)
        with tempfile.TemporaryDirectory() as work:
            base = os.path.join(work, 'app')
            populate(tools, base, rng, work)
            for name, location, slots in TARGETS:
                target = os.path.join(base, location)
                for index in range(slots):
                    slot = target if slots == 1 else os.path.join(target, str(index))
                    what = damage(slot, rng) if rng.random() < 0.5 else 'none'
                    ours = read_store.read_slot(target, slots, index)
                    theirs = answers(tools[1], base, name, work, index)[index]
                    compared += 1
                    if ours != theirs:
                        disagreements += 1
                        print('seed %d %s %d after %s: read_store says "%s", inspect_store "%s"'
                              % (seed, name, index, what, ours, theirs))
    print('%d slots compared, %d disagreements' % (compared, disagreements))
    return 1 if disagreements or compared == 0 else 0


if __name__ == '__main__':
    sys.exit(main())
