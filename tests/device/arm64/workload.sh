#!/bin/sh
# The power-cut workload of the emulated device (scripts/arm64-device.sh
# power-cuts): stores on /var/nonvolatile written in a loop until the host
# cuts the power, reported over the console in lines power_cuts.py reads.
#
#   workload.sh          report every store, then run operations from the
#                        kernel command line's arm64_op=N on, forever
#   workload.sh verify   report every store and stop
#
# Report of the stores, first thing after each boot:
#   @@ state KEY exists=E valid=V read=S size=N crc32=C   (one per slot)
#   @@ query KEY STATUS                                    (the tool's --query-present)
#   @@ state done
# Each operation, announced before it starts and acknowledged when it
# returned, with the state it must leave (found by running it first on a
# copy of the stores in memory) and the state it left:
#   @@ op N KEY expect=STATE
#   @@ ack N STATUS STATE
# A migration has a rival: another migration of the same slot with a blob
# of its own, started beside it, and a loop of --query-present of the slot
# beside both. They are announced after the operation and reported before
# its acknowledgement:
#   @@ rival N KEY expect=STATE
#   @@ rivalack N STATUS
#   @@ queries N present=P absent=A other=O
# With arm64_writer=broken the operations are those of a writer that
# rewrites the current copy in place, which a power cut can catch.
. /etc/arm64-device.conf
tool=$installed_tools/migrate_settings
make_data=$build_dir/lib/storage/tools/make_example_data
driver=$build_dir/tests/lib/storage/dual_file_driver
broken_writer=$build_dir/tests/crash/broken_order_writer
stores=/var/nonvolatile/power-cuts
copy=/tmp/power-cuts
blobs=/tmp/blobs
broken_pause_ms=1500

first_op=0
writer=store
for word in $(cat /proc/cmdline); do
    case $word in
        arm64_op=*) first_op=${word#arm64_op=} ;;
        arm64_writer=*) writer=${word#arm64_writer=} ;;
    esac
done

# The slots, as KEY STORE SLOTS SLOT [TOOL_TARGET INDEX]: a one-slot target,
# three slots of a multi-slot one, and a store only the driver writes.
slots() {
    echo settings app/settings 1 0 settings 0
    echo overlay0 app/app/overlays 8 0 overlay 0
    echo overlay1 app/app/overlays 8 1 overlay 1
    echo overlay2 app/app/overlays 8 2 overlay 2
    echo driver driver 1 0
}

# state ROOT KEY: what the slot reads as, in the driver's summary.
state() {
    slots | while read -r key store count slot target index; do
        [ "$key" = "$2" ] || continue
        "$driver" -s "$1/$store" "$count" "$slot" | tail -n 1 | sed 's/^state: //'
    done
}

report() {
    slots | while read -r key store count slot target index; do
        echo "@@ state $key $(state "$stores" "$key")"
    done
    slots | while read -r key store count slot target index; do
        [ -n "$target" ] || continue
        "$tool" --base "$stores/app" --target "$target" --index "$index" --query-present >/dev/null 2>&1
        echo "@@ query $key $?"
    done
    echo "@@ state done"
}

# Blobs of every kind and size the operations use, up to 1 MiB; the same
# at every boot.
make_blobs() {
    mkdir -p "$blobs"
    while read -r kind name size; do
        "$make_data" "$kind" "$blobs/$name" "$size" >/dev/null
    done <<EOF
settings settings-small 100
settings settings-mid 4000
settings settings-large 65535
overlay overlay-small 1024
overlay overlay-mid 300000
overlay overlay-large 1048292
EOF
    # A settings block whose check fails: the redundant migration must take
    # the other candidate.
    cp "$blobs/settings-mid" "$blobs/settings-bad"
    printf '\377\377\377\377' | dd of="$blobs/settings-bad" bs=1 seek=8 conv=notrunc 2>/dev/null
    "$make_data" settings "$blobs/settings-rival" 2000 >/dev/null
    "$make_data" overlay "$blobs/overlay-rival" 50000 >/dev/null
    head -c 1048576 "$blobs/overlay-large" >"$blobs/raw-large"
    tail -c 5000 "$blobs/overlay-mid" >"$blobs/raw-small"
}

# The operations, in the order they cycle through: KEY then what runs.
# "tool ARGS" runs migrate_settings on the stores, "driver STEPS" the store
# driver on the driver's slot, "broken BLOB" the broken writer on settings.
operations() {
    if [ "$writer" = broken ]; then
        echo settings broken settings-mid
        echo settings broken overlay-mid
        return
    fi
    echo settings tool --target settings --type simple --data settings-small
    echo overlay0 tool --target overlay --index 0 --type checked --check overlay --data overlay-large
    echo driver driver beginWrite writeAt 0 raw-large writeAt 1048576 raw-small finalise
    echo settings tool --target settings --type checked --data settings-mid
    echo overlay1 tool --target overlay --index 1 --type simple --data overlay-small
    echo driver driver writeAt 0 raw-small
    echo settings tool --target settings --type redundant --data settings-bad --data2 settings-large
    echo overlay2 tool --target overlay --index 2 --type redundant --check overlay --data overlay-mid --data2 overlay-large
    echo overlay0 tool --target overlay --index 0 --type simple --data overlay-mid
    echo driver driver erase
    echo overlay1 tool --target overlay --index 1 --type checked --check overlay --data overlay-large
    echo overlay2 tool --target overlay --index 2 --type simple --data overlay-small
}

# rival KEY KIND: the migration that runs beside an operation of KIND on
# KEY, or nothing.
rival() {
    [ "$2" = tool ] || return 0
    case $1 in
        settings) echo tool --target settings --type simple --data settings-rival ;;
        overlay*) echo tool --target overlay --index "${1#overlay}" --type simple --data overlay-rival ;;
    esac
}

# queries KEY FLAG: --query-present of the slot while FLAG exists, then how
# many answers said present, absent and anything else.
queries() {
    present=0 absent=0 other=0
    set -- $(slots | while read -r key store count slot target index; do
        [ "$key" = "$1" ] && echo "$target $index"
    done) "$2"
    while [ -e "$3" ]; do
        "$tool" --base "$stores/app" --target "$1" --index "$2" --query-present >/dev/null 2>&1
        case $? in
            0) present=$((present + 1)) ;;
            10) absent=$((absent + 1)) ;;
            *) other=$((other + 1)) ;;
        esac
    done
    echo "present=$present absent=$absent other=$other"
}

# run ROOT KIND ARGS...: one operation on the stores under ROOT.
run() {
    root=$1 kind=$2
    shift 2
    case $kind in
        tool)
            set -- $(echo "$*" | sed "s| --data | --data $blobs/|; s| --data2 | --data2 $blobs/|")
            "$tool" --base "$root/app" "$@" >/dev/null 2>&1
            ;;
        driver)
            set -- $(echo "$*" | sed "s|raw-|$blobs/raw-|g")
            "$driver" "$root/driver" 1 0 "$@" >/dev/null 2>&1
            ;;
        broken)
            # On the card it lingers between data and check file, so that
            # the random cuts meet that window within a few tries; the run
            # on the copy in memory only tells what it leaves.
            pause=0
            [ "$root" = "$stores" ] && pause=$broken_pause_ms
            mkdir -p "$root/app/settings"
            "$broken_writer" --in-place --pause-ms="$pause" "$root/app/settings" "$blobs/$1" >/dev/null 2>&1
            ;;
    esac
}

mkdir -p "$stores/app" "$stores/driver"
report
[ "${1:-}" = verify ] && exit 0
make_blobs
total=$(operations | wc -l)
op=$first_op
while :; do
    line=$(operations | sed -n "$((op % total + 1))p")
    set -- $line
    key=$1
    shift
    rm -rf "$copy"
    cp -a "$stores" "$copy"
    run "$copy" "$@"
    echo "@@ op $op $key expect=$(state "$copy" "$key")"
    rival_words=$(rival "$key" "$1")
    if [ -n "$rival_words" ]; then
        rm -rf "$copy"
        cp -a "$stores" "$copy"
        run "$copy" $rival_words
        echo "@@ rival $op $key expect=$(state "$copy" "$key")"
        touch /tmp/querying
        queries "$key" /tmp/querying >/tmp/query-counts &
        querying=$!
        run "$stores" $rival_words &
        rivalling=$!
    fi
    run "$stores" "$@"
    status=$?
    if [ -n "$rival_words" ]; then
        wait "$rivalling"
        echo "@@ rivalack $op $?"
        rm -f /tmp/querying
        wait "$querying"
        echo "@@ queries $op $(cat /tmp/query-counts)"
    fi
    echo "@@ ack $op $status $(state "$stores" "$key")"
    op=$((op + 1))
done
