// What inspect_store does once its command line is known. Each returns the
// exit status: 0 nothing wrong, 1 damage or a failure (reported on standard
// error, naming the path), 10 for a dump of a slot that is not present.
#pragma once

#include "inspect_options.h"

constexpr int kInspectClean = 0;
constexpr int kInspectDamage = 1;
constexpr int kInspectUsage = 2;
constexpr int kInspectNotPresent = 10;

// The report on every dual-file target, or the one of --target (and
// --index), plain or JSON on standard output.
int reportStores(const InspectOptions& options);

// Writes the data the slot serves to the dump file, nothing else.
int dumpSlot(const InspectOptions& options);

// Locates and reads the boot-vector record as the boot-vector target does
// and reports its sector, value and checksums.
int reportBootVector(bool json);
