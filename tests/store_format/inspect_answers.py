"""What inspect_store says each slot serves, in read_store.py's words, for
the tests that hold the two readers against each other."""
import json
import os
import subprocess
import zlib


def run(*words, allowed=(0,)):
    result = subprocess.run(words, stdout=subprocess.PIPE, stderr=subprocess.PIPE)
    if result.returncode not in allowed:
        raise AssertionError('%s exited %d: %s%s' % (' '.join(words), result.returncode, result.stdout.decode(),
                                                    result.stderr.decode()))
    return result


def answers(inspect, base, name, work, index=None):
    """{slot index: answer} for target `name` under `base`: every slot, or
    only `index`. `work` is a directory for the dumps."""
    words = [inspect, '--base', base, '--target', name, '--json']
    if index is not None:
        words += ['--index', str(index)]
    # 1: the report names a problem.
    report = json.loads(run(*words, allowed=(0, 1)).stdout)
    result = {}
    for slot in report['targets'][0]['slots']:
        if slot['state'] == 'absent-blob':
            result[slot['index']] = 'absent-blob %d' % slot['current']
            continue
        if slot['state'] != 'present':
            result[slot['index']] = 'none'
            continue
        dump = os.path.join(work, 'dump')
        run(inspect, '--base', base, '--target', name, '--index', str(slot['index']), '--dump=' + dump)
        with open(dump, 'rb') as f:
            blob = f.read()
        result[slot['index']] = 'present %d %d 0x%08x' % (slot['current'], len(blob), zlib.crc32(blob))
    return result
