#!/usr/bin/env python3
"""Turns a build's test list (ctest --show-only=json-v1 on standard input)
into the list that tests/device/arm64/run_tests.sh runs on the device.

Most tests are GoogleTest cases, one ctest test each. Started one by one,
each pays a program's start, which an emulated CPU makes dear; so the
cases of one program that run alike (same directory, environment, time
limit and skip rule, not alone, not on the device) go into groups of up
to GROUP_SIZE, each group one run of the program with a filter naming its
cases, and every case still gets its own verdict:

    g DIR LIMIT 'NAME NAME ...' COMMAND...

Every other test is one line, a call of the function t with whether it
must run alone (1 or 0), whether it is a device test (label "device": it
gets the eMMC; the others see the device as a build host, 1 or 0), its
name, working directory, skip return code, time limit, pass and skip
expressions and expected failure, then its command:

    t SERIAL DEVICE NAME DIR SKIP_CODE LIMIT PASS_RE SKIP_RE WILL_FAIL COMMAND...

The first line says how many tests the list holds: "# N tests".

    test_list.py [--time-factor N] EMULATOR_WORDS... < tests.json > tests.list

Time limits are the tests' own, multiplied by N (default 1): an emulated
CPU runs the programs several times slower than the machines the limits
were set on. A group's limit is its cases' limits added up.

Leading words of a command that are the build's emulator (qemu-aarch64 and
its options, which gtest_discover_tests puts before every test program) are
dropped: on the device the programs run as they are.
"""

import json
import shlex
import sys

DEFAULT_TIME_LIMIT = 1500  # ctest's own default
LONG_LABELS = {"crash", "soak"}
GROUP_SIZE = 100
GTEST_SKIP_RE = "\\[  SKIPPED \\]"


def labels(test):
    for p in test.get("properties", []):
        if p["name"] == "LABELS":
            return p["value"]
    return []


def main():
    emulator = sys.argv[1:]
    time_factor = 1
    if emulator[:1] == ["--time-factor"]:
        time_factor = int(emulator[1])
        emulator = emulator[2:]
    tests = json.load(sys.stdin)["tests"]
    # The long kinds first, so that parallel workers end together.
    tests.sort(key=lambda test: not LONG_LABELS & set(labels(test)))
    # In the order of their first test: a t line's words, or a group's
    # [directory, command words, cases].
    items = []
    open_groups = {}
    for test in tests:
        properties = {p["name"]: p["value"] for p in test.get("properties", [])}
        command = list(test["command"])
        if emulator and command[: len(emulator)] == emulator:
            command = command[len(emulator):]
        fields = [
            "1" if properties.get("RUN_SERIAL") else "0",
            "1" if "device" in labels(test) else "0",
            test["name"],
            properties.get("WORKING_DIRECTORY", "/"),
            str(properties.get("SKIP_RETURN_CODE", "")),
            str(int(float(properties.get("TIMEOUT", DEFAULT_TIME_LIMIT))) * time_factor),
            "|".join(properties.get("PASS_REGULAR_EXPRESSION", [])),
            "|".join(properties.get("SKIP_REGULAR_EXPRESSION", [])),
            "1" if properties.get("WILL_FAIL") else "0",
        ]
        words = ["env"] + properties.get("ENVIRONMENT", []) + command
        case_filter = "--gtest_filter=" + test["name"]
        alike = fields[:2] == ["0", "0"] and fields[4] == "" and fields[6] == "" and fields[7] == GTEST_SKIP_RE \
            and fields[8] == "0" and words.count(case_filter) == 1
        if not alike:
            items.append(("t", fields + words))
            continue
        words.remove(case_filter)
        key = (fields[3], tuple(words))
        group = open_groups.get(key)
        if group is None or len(group[2]) == GROUP_SIZE:
            group = open_groups[key] = [fields[3], words, []]
            items.append(("g", group))
        group[2].append((test["name"], int(fields[5])))
    print(f"# {len(tests)} tests")
    for kind, item in items:
        if kind == "t":
            print("t " + " ".join(shlex.quote(word) for word in item))
        else:
            print_group(*item)


def print_group(directory, words, cases):
    limit = sum(limit for _, limit in cases)
    names = " ".join(name for name, _ in cases)
    print("g " + " ".join(shlex.quote(word) for word in [directory, str(limit), names] + words))


if __name__ == "__main__":
    main()
