// Shared by the modes of fault_probe (see fault_probe.cpp).
#pragma once

#include <functional>
#include <string>

namespace fault_probe {

// Runs `call`, which returns a negative value on failure with errno set,
// and prints "<name> <result>" or "<name> failed <errno>".
void step(const char* name, const std::function<long()>& call);

// 0 for true, -1 for false.
long succeeded(bool ok);

// "fault_probe record DIR": every kind of call the shim records, in the
// variants it handles, then calls that fail and writes to files that are
// not regular. Expects in DIR: "old", "log" ("log\n"), "source"
// ("source data\n"), "replaced", "gone", "gone2", "gone3" and the empty
// directory "emptydir".
int runRecord(const std::string& dir);

}  // namespace fault_probe
