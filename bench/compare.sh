#!/usr/bin/env bash
# Whole processes side by side on one scratch store: the tool's query and a
# checked migration of a 4 KiB settings block (also with the tool linked
# fully static, as the device runs it), fw_setenv rewriting a 16 KiB
# redundant environment kept in two files, sqlite3 storing the same 4 KiB
# blob with synchronous=FULL, and floor_write (the least a process can do to
# store it the way the dual-file store does). Then the peak RSS of
# migrating a 16 MiB data file against the file's size.
#   bench/compare.sh [BUILD_DIR [RESULTS_DIR]]
# BUILD_DIR defaults to build/bench (scripts/bench.sh --build-only makes it).
# Prints Markdown tables on standard output; with RESULTS_DIR, hyperfine's
# JSON and CSV and the peak RSS figures are also written there.
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
build=${1:-$root/build/bench}
results=${2:-}
runs=${COMPARE_RUNS:-60}

tool=$build/lib/storage/tools/migrate_settings
static_tool=$build/bench/migrate_settings_static
make_data=$build/lib/storage/tools/make_example_data
floor=$build/bench/floor_write
for program in "$tool" "$static_tool" "$make_data" "$floor"; do
  [ -x "$program" ] || { echo "missing $program (scripts/bench.sh --build-only builds it)" >&2; exit 1; }
done
for program in hyperfine fw_setenv fw_printenv sqlite3 /usr/bin/time; do
  command -v "$program" >/dev/null || { echo "missing $program (scripts/install-deps.sh bench)" >&2; exit 1; }
done

# hyperfine -N splits the command lines at blanks.
scratch=$(mktemp -d "${TMPDIR:-/tmp}/migrate-settings-compare.XXXXXX")
trap 'rm -rf "$scratch"' EXIT
case $scratch in *[[:space:]]*) echo "the scratch path must not contain blanks: $scratch" >&2; exit 1 ;; esac
raw=${results:-$scratch}
mkdir -p "$raw"

# --- The same data for everybody, and every store holding it already ---
settings=$scratch/settings.bin
"$make_data" settings "$settings" 4096
store=$scratch/store
# Off the device every run logs that the boot vector cannot be located.
for _ in 1 2; do  # twice: both copies valid, as after any second migration
  "$tool" --base "$store" --target settings --type checked --check settings --data "$settings" >/dev/null 2>&1
done
"$tool" --base "$store" --target settings --query-present >/dev/null 2>&1 ||
  { echo "the tool did not store the settings block" >&2; exit 1; }

# Each env file starts zeroed; the first write finds no valid copy and
# starts from the default environment, the second makes both copies valid.
env=$scratch/ubootenv
mkdir "$env"
printf '# device offset size\n%s 0x0 0x4000\n%s 0x0 0x4000\n' "$env/env1" "$env/env2" >"$env/fw_env.config"
head -c 16384 /dev/zero >"$env/env1"
head -c 16384 /dev/zero >"$env/env2"
printf 'bootdelay=3\n' >"$env/default"
value=$(head -c 3072 "$settings" | base64 -w 0)  # 4096 characters
for _ in 1 2; do
  fw_setenv -c "$env/fw_env.config" -f "$env/default" settings "$value" 2>/dev/null
done
[ "$(fw_printenv -c "$env/fw_env.config" -n settings 2>/dev/null)" = "$value" ] ||
  { echo "fw_setenv did not store the environment" >&2; exit 1; }

database=$scratch/sqlite/store.db
mkdir "$scratch/sqlite"
sqlite3 "$database" 'CREATE TABLE blob(id INTEGER PRIMARY KEY, data BLOB);'
insert="PRAGMA synchronous=FULL; INSERT OR REPLACE INTO blob(id, data) VALUES (0, readfile('$settings'));"
sqlite3 "$database" "$insert"
[ "$(sqlite3 "$database" 'SELECT length(data) FROM blob WHERE id = 0;')" = 4096 ] ||
  { echo "sqlite3 did not store the blob" >&2; exit 1; }

mkdir "$scratch/floor"
"$floor" "$settings" "$scratch/floor"

# --- Timing ---
# A sync before each run (untimed): every run's own sync then writes back
# only what that run wrote, as on a device where nothing else writes.
hyperfine -N --style none --warmup 5 --runs "$runs" --prepare sync \
  --export-csv "$raw/hyperfine.csv" --export-json "$raw/hyperfine.json" \
  -n query "$tool --base $store --target settings --query-present" \
  -n migrate "$tool --base $store --target settings --type checked --check settings --data $settings" \
  -n migrate_static "$static_tool --base $store --target settings --type checked --check settings --data $settings" \
  -n boot_vector_query "sh -c \"/usr/sbin/sfdisk -q -n -F /dev/mmcblk0 | tail -1\"" \
  -n fw_setenv "fw_setenv -c $env/fw_env.config settings $value" \
  -n sqlite3 "sqlite3 $database \"$insert\"" \
  -n floor "$floor $settings $scratch/floor" >/dev/null

echo "| Process | Median | × floor |"
echo "|---|---:|---:|"
awk -F, '
  BEGIN {
    what["query"] = "`migrate_settings --query-present` (settings)"
    what["migrate"] = "`migrate_settings --type checked --check settings`, 4 KiB"
    what["migrate_static"] = "the same, tool linked fully static (as on the device)"
    what["boot_vector_query"] = "the partitioning-tool query that every run of the tool makes, alone"
    what["fw_setenv"] = "`fw_setenv`, 4 KiB value, 16 KiB redundant environment"
    what["sqlite3"] = "`sqlite3`, 4 KiB blob, `synchronous=FULL`"
    what["floor"] = "`floor_write`, 4 KiB (the floor, fully static)"
  }
  NR > 1 { name[NR] = $1; median[NR] = $4; if ($1 == "floor") floor = $4 }
  END {
    for (i = 2; i <= NR; ++i) printf "| %s | %.2f ms | %.2f |\n", what[name[i]], median[i] * 1000, median[i] / floor
  }' "$raw/hyperfine.csv"

# --- Peak RSS: the largest of three runs ---
large=$scratch/large.bin
"$make_data" overlay "$large" $((16 * 1024 * 1024 - 284))
peak_kib() {
  local peak=0 kib
  for _ in 1 2 3; do
    /usr/bin/time -o "$scratch/rss" -f %M "$@" >/dev/null 2>&1 || { echo "failed: $*" >&2; return 1; }
    kib=$(cat "$scratch/rss")
    [ "$kib" -gt "$peak" ] && peak=$kib
  done
  echo "$peak"
}
data_bytes=$(stat -c %s "$large")
# Assignments, so that a failing run stops the script.
migrate_peak=$(peak_kib "$tool" --base "$store" --target overlay --type checked --check overlay --data "$large")
static_peak=$(peak_kib "$static_tool" --base "$store" --target overlay --type checked --check overlay --data "$large")
floor_peak=$(peak_kib "$floor" "$large" "$scratch/floor")
query_peak=$(peak_kib "$tool" --base "$store" --target settings --query-present)
[ "$(stat -c %s "$store/app/overlays/0/2/data")" = "$data_bytes" ] ||
  { echo "the tool did not store the large overlay" >&2; exit 1; }
{
  echo "process,data_bytes,peak_rss_kib"
  echo "migrate,$data_bytes,$migrate_peak"
  echo "migrate_static,$data_bytes,$static_peak"
  echo "floor,$data_bytes,$floor_peak"
  echo "query,0,$query_peak"
} >"$raw/peak_rss.csv"

echo
echo "| Process | Data file | Peak RSS | Peak RSS − data file |"
echo "|---|---:|---:|---:|"
awk -F, '
  BEGIN {
    what["migrate"] = "`migrate_settings --type checked --check overlay`"
    what["migrate_static"] = "the same, tool linked fully static (as on the device)"
    what["floor"] = "`floor_write`"
    what["query"] = "`migrate_settings --query-present` (no data file)"
  }
  NR > 1 {
    data = $2 / 1048576; peak = $3 / 1024
    printf "| %s | %.1f MiB | %.1f MiB | %.1f MiB |\n", what[$1], data, peak, peak - data
  }' "$raw/peak_rss.csv"
