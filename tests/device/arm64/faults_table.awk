# The faults campaign's cases as a Markdown table, a row for each file
# system, operation and fault, with the recoveries its cases met:
#   awk -f faults_table.awk build/arm64-device/faults-full-console.log
# Only the lines of the campaign proper ("@@ case N ..."), up to its totals:
# the broken store's cases follow them.
/^@@ faults: [0-9]+ cases/ { done = 1 }
done || !/^@@ case [0-9]+ / { next }
{
    fs = $4
    operation = $5
    fault = $6
    recovery = $7
    sub(/:$/, "", recovery)
    if (operation ~ /^read-/) {
        fault = "reads of the current copy's " (operation == "read-data" ? "data" : "check") " file fail"
        operation = "query"
    } else if (fault == "read-only") {
        fault = "file system read-only"
    } else if (fault ~ /^full-but-/) {
        fault = "file system full"
    } else if (fault ~ /^writes-fail@[0-9]+\/[0-9]+$/) {
        split(substr(fault, 13), step, "/")
        fault = step[1] + 0 > step[2] + 0 ? "writes fail after it returned" : "writes fail at a step"
    } else {
        fault = "writes fail" (fault == "writes-fail@0" ? " before it" : " at a step")
    }
    key = fs " | " operation " | " fault
    if (!(key in cases)) order[++rows] = key
    if (!((key, recovery) in met)) {
        met[key, recovery] = 1
        recoveries[key] = recoveries[key] (recoveries[key] == "" ? "" : ", ") recovery
    }
    cases[key]++
    status = $0
    if (sub(/.* (exit|finalise)=/, "", status)) {
        split(status, word, /[ (]/)
        if (word[1] == "0") returned[key]++
        else failed[key]++
    }
    which = $0
    if (match(which, / served=[^ ]*/)) {
        which = substr(which, RSTART + 8, RLENGTH - 8)
        sub(/.*\//, "", which)
        if (which == "neither") which = "other"
        served[key, which]++
    }
    for (i = 8; i <= NF; i++) {
        if ($i ~ /^(ok|lost|hang|crash|failed|stale)$/) {
            result[key, $i]++
            break
        }
    }
}
END {
    print "| file system | operation | fault | recoveries | cases | returned 0 | failed | served old | served new | other | lost | hangs | crashes | failed otherwise | stale |"
    print "|---|---|---|---|---:|---:|---:|---:|---:|---:|---:|---:|---:|---:|---:|"
    for (r = 1; r <= rows; r++) {
        k = order[r]
        printf "| %s | %s | %d | %d | %d | %d | %d | %d | %d | %d | %d | %d | %d |\n", k, recoveries[k], cases[k], returned[k], failed[k],
            served[k, "old"], served[k, "new"], served[k, "other"], result[k, "lost"], result[k, "hang"],
            result[k, "crash"], result[k, "failed"], result[k, "stale"]
    }
}
