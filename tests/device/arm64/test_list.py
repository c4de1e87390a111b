#!/usr/bin/env python3
"""Turns a build's test list (ctest --show-only=json-v1 on standard input)
into the list that tests/device/arm64/run_tests.sh runs on the device: one
line per test, a call of its function t with whether the test must run
alone (1 or 0), whether it is a device test (label "device": it gets the
eMMC; the others see the device as a build host, 1 or 0), its name, working directory, skip return code, time limit,
pass and skip expressions and expected failure, then its command.

    test_list.py [--time-factor N] EMULATOR_WORDS... < tests.json > tests.list

Time limits are the tests' own, multiplied by N (default 1): an emulated
CPU runs the programs several times slower than the machines the limits
were set on.

Leading words of a command that are the build's emulator (qemu-aarch64 and
its options, which gtest_discover_tests puts before every test program) are
dropped: on the device the programs run as they are.
"""

import json
import shlex
import sys

DEFAULT_TIME_LIMIT = 1500  # ctest's own default
LONG_LABELS = {"crash", "soak"}


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
        environment = properties.get("ENVIRONMENT", [])
        words = fields + ["env"] + environment + command
        print("t " + " ".join(shlex.quote(word) for word in words))


if __name__ == "__main__":
    main()
