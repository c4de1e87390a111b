#!/usr/bin/env bash
# Applies each single-line mutant of scripts/mutants.list to the product on
# its own, rebuilds and runs the test suite, and says whether the suite
# killed it (some test failed) or it survived. The changed file is put back
# after every mutant, and by a trap on any way out of the script.
#   mutants.sh [NUMBER...]   only the entries with these numbers (from 1)
#   mutants.sh --list        the entries, numbered
# Exits 1 when a mutant that can be seen from outside survived, or when an
# entry no longer matches the source. Takes tens of minutes: not part of CI;
# run it before each release (docs/RELIABILITY.md has the last result).
set -euo pipefail
cd "$(dirname "$0")/.."
readonly list=scripts/mutants.list
readonly build=build/mutants

mapfile -t entries < <(grep -v -e '^#' -e '^$' "$list")
if [ "${1:-}" = --list ]; then
  for i in "${!entries[@]}"; do
    IFS=$'\t' read -r file _ _ rule unseen <<<"${entries[$i]}"
    printf '%2d  %-42s %s%s\n' $((i + 1)) "$file" "$rule" "${unseen:+ ($unseen)}"
  done
  exit 0
fi
selected=("$@")
[ ${#selected[@]} -gt 0 ] || mapfile -t selected < <(seq 1 ${#entries[@]})

scripts/install-deps.sh tests
cmake --preset default -B "$build" >/dev/null
cmake --build "$build" >/dev/null

backup=$(mktemp -d /tmp/mutants.XXXXXX)
mutated=
# Put back with a new time, so that the build replaces the mutant's objects.
restore() {
  if [ -n "$mutated" ]; then
    cp "$backup/original" "$mutated"
    touch "$mutated"
    mutated=
  fi
}
trap 'restore; rm -rf "$backup"' EXIT
trap 'exit 130' INT TERM

# Replaces the one occurrence of $2 in file $1 by $3; fails when $2 is not
# there exactly once.
mutate() {
  python3 - "$@" <<'EOF'
import sys
path, before, after = sys.argv[1:4]
text = open(path).read()
if text.count(before) != 1:
    sys.exit(1)
open(path, "w").write(text.replace(before, after))
EOF
}

killed=0 survived=0 unseen_survived=0 stale=0 broken=0
for number in "${selected[@]}"; do
  IFS=$'\t' read -r file before after rule unseen <<<"${entries[$((number - 1))]}"
  start=$SECONDS
  cp "$file" "$backup/original"
  mutated=$file
  if ! mutate "$file" "$before" "$after"; then
    restore
    stale=$((stale + 1))
    printf '%2d STALE     %s: the line is not in %s once\n' "$number" "$rule" "$file"
    continue
  fi
  if ! cmake --build "$build" >"$backup/build.log" 2>&1; then
    verdict=killed detail="does not build"
    broken=$((broken + 1))
    killed=$((killed + 1))
  elif ctest --test-dir "$build" -j 2 --stop-on-failure >"$backup/test.log" 2>&1; then
    if [ -n "${unseen:-}" ]; then
      verdict=unseen detail="survived as expected: ${unseen#unseen: }"
      unseen_survived=$((unseen_survived + 1))
    else
      verdict=SURVIVED detail="no test failed"
      survived=$((survived + 1))
    fi
  else
    first=$(grep -m1 -E 'Test +#[0-9]+: .*\*\*\*(Failed|Timeout|Exception)' "$backup/test.log" | sed -E 's/.*Test +#[0-9]+: ([^ ]+).*/\1/')
    verdict=killed detail="by ${first:-the test run}"
    killed=$((killed + 1))
  fi
  restore
  printf '%2d %-9s %s [%s] %ss\n' "$number" "$verdict" "$rule" "$detail" $((SECONDS - start))
  unset unseen
done

# Leave the build as the tree is.
cmake --build "$build" >/dev/null
echo "mutants: ${#selected[@]} tried, $killed killed ($broken of them do not build), $survived survived," \
  "$unseen_survived unseen survived as expected, $stale stale"
[ "$survived" -eq 0 ] && [ "$stale" -eq 0 ]
