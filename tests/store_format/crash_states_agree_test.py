#!/usr/bin/env python3
"""read_store.py, written from docs/STORE_FORMAT.md alone, agrees with
inspect_store on every slot of every state the crash exploration opens a
store on: each power cut's leftovers, and each clean-up that a second cut
stopped part way.

    crash_states_agree_test.py CRASH_EXPLORATION_TESTS INSPECT_STORE
"""
import os
import re
import shutil
import subprocess
import sys
import tempfile
import time

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, HERE)
import read_store  # noqa: E402
from inspect_answers import answers  # noqa: E402

# inspect_store reads only the tool's targets. A one-slot state is a
# one-slot target's directory; the slot directories 0 to n-1 of a state of
# n slots are the first n of a target of more.
HOSTS = [('settings', 'settings', 1), ('overlay', 'app/overlays', 8)]
REPORTED = 20


def host(slots):
    return next(row for row in HOSTS if (row[2] == 1) == (slots == 1) and row[2] >= slots)


def scratch_parent():
    """Memory when the machine has it: thousands of small trees."""
    return '/dev/shm' if os.access('/dev/shm', os.W_OK) else None


def explore(program, states):
    """Runs the exploration, which writes each state into `states`."""
    env = dict(os.environ, CRASH_STATES_DIR=states)
    result = subprocess.run([program], env=env, stdout=subprocess.PIPE, stderr=subprocess.STDOUT)
    totals = [line for line in result.stdout.decode().splitlines() if line.startswith('crash exploration totals')]
    if result.returncode != 0 or not totals:
        raise AssertionError('the exploration failed:\n' + result.stdout.decode())
    print(totals[0])


def main():
    program, inspect = sys.argv[1:3]
    started = time.monotonic()
    compared = disagreements = 0
    with tempfile.TemporaryDirectory(dir=scratch_parent()) as work:
        states = os.path.join(work, 'states')
        explore(program, states)
        names = sorted(os.listdir(states))
        base = os.path.join(work, 'base')
        for state in names:
            slots = int(re.search(r'_(\d+)slot_', state).group(1))
            name, location, host_slots = host(slots)
            target = os.path.join(base, location)
            os.makedirs(os.path.dirname(target), exist_ok=True)
            os.rename(os.path.join(states, state), target)
            theirs = answers(inspect, base, name, work)
            for index in range(slots):
                ours = read_store.read_slot(target, host_slots, index)
                compared += 1
                if ours != theirs[index]:
                    disagreements += 1
                    if disagreements <= REPORTED:
                        print('%s slot %d: read_store says "%s", inspect_store "%s"'
                              % (state, index, ours, theirs[index]))
            shutil.rmtree(target)
    print('%d states read, %d slots compared, %d disagreements, %.0f s'
          % (len(names), compared, disagreements, time.monotonic() - started))
    return 1 if disagreements or compared == 0 else 0


if __name__ == '__main__':
    sys.exit(main())
