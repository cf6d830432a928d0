#!/usr/bin/env bash
# The daemon's main job on a host, end to end: kernel records written to emulated device
# nodes become events that the privacy policy filters and that are counted, paced and stored in
# event.db under the shipped quotas, and whose logs are packed into zip packs for upload. Starts
# orvane-devsim and the daemon in a sandbox folder, writes a stream of records, shows what was
# stored and what was dropped and why, which log packs were made and handed over, makes CPU
# pressure that the kernel's pressure stall trigger turns into a performance event (where
# triggers can be armed), reports the log filter statistics of a stand-in "logcat -S", then
# stops everything it started.
# Assumes `make build` has run. BUILD names the build folder (default: build);
# ORVANE_DEMO_KEEP=1 keeps the sandbox folder for a look afterwards.
#
# usage: demo.sh             the demonstration (well under two minutes)
#        demo.sh load [S]    load figures instead: throughput for S seconds per run (default 60)
#        demo.sh flood [N [B]]  memory under a flood of N records of B bytes (default 100000, 3072)
set -euo pipefail

MODE=${1:-demo}
LOAD_SECONDS=${2:-60}
FLOOD_RECORDS=${2:-100000}
FLOOD_BYTES=${3:-3072}
case "$MODE" in
    demo | load | flood) ;;
    *)
        echo "usage: $0 [load [SECONDS] | flood [RECORDS [BYTES]]]" >&2
        exit 2
        ;;
esac

ROOT=$(cd "$(dirname "$0")/.." && pwd)
BUILD_NAME=${BUILD:-build}
BUILD=$(cd "$ROOT" && cd "$BUILD_NAME" 2> /dev/null && pwd) || {
    echo "demo: build folder $BUILD_NAME not found; run 'make build' first" >&2
    exit 1
}
for tool in orvane orvane-devsim orvane-pressure; do
    if [ ! -x "$BUILD/$tool" ]; then
        echo "demo: $BUILD/$tool is missing; run 'make build' first" >&2
        exit 1
    fi
done
command -v sqlite3 > /dev/null || { echo "demo: sqlite3 is missing; run 'make deps'" >&2; exit 1; }

SANDBOX=$(mktemp -d /tmp/orvane-demo-XXXXXX)
DEV=$SANDBOX/dev
WORK=$SANDBOX/work
mkdir -p "$DEV" "$WORK" "$SANDBOX/cloud"
export ORVANE_PROPERTY_FILE=$SANDBOX/properties
cat > "$ORVANE_PROPERTY_FILE" <<'EOF'
ro.quor.build.region=CN
ro.quor.build.type=1
ro.serialno=DEMO0001
persist.sys.orvane.upload_switch=1
persist.sys.orvane.safecheck=0
EOF
# The log filter's statistics: the filter configured, and a stand-in "logcat" first on PATH that
# prints what the phone's log daemon prints for "logcat -S".
cat >> "$ORVANE_PROPERTY_FILE" <<'EOF'
persist.sys.log_filter_flag=1
persist.sys.log_time_gap_sec=10
persist.sys.log_max_line=200
EOF
mkdir -p "$SANDBOX/bin"
cat > "$SANDBOX/bin/logcat" <<'EOF'
#!/bin/sh
[ "$1" = -S ] || exit 1
now=$(date +%s)
cat <<STATS
size/num main               system              crash
Total    1.2MB/8123         512KB/2310          0B/0
Log Filter Top PIDs:
PID/UID  NAME  FILTERED_LINES FILTER_COUNT MAX_COUNT MAX_TIME
1843/1000 system_server 5230 41 380 $((now - 3600))
2710/10089 com.example.chatty 1944 17 260 $((now - 600))
912/1041 /system/bin/audioserver 310 4 95 $((now - 7200))
STATS
EOF
chmod 755 "$SANDBOX/bin/logcat"
export PATH=$SANDBOX/bin:$PATH
# Activated ten days ago: within the upload period of event_quota.xml.
echo "persist.sys.orvane.activate_time=$(($(date +%s) - 864000))" >> "$ORVANE_PROPERTY_FILE"

DEVSIM_PID=
DAEMON_PID=
PRESSURE_PID=
stop_processes() {
    if [ -n "$PRESSURE_PID" ]; then
        kill "$PRESSURE_PID" 2> /dev/null || true
        wait "$PRESSURE_PID" 2> /dev/null || true
        PRESSURE_PID=
    fi
    if [ -n "$DAEMON_PID" ]; then
        kill "$DAEMON_PID" 2> /dev/null || true
        wait "$DAEMON_PID" 2> /dev/null || true
        DAEMON_PID=
    fi
    if [ -n "$DEVSIM_PID" ]; then
        kill "$DEVSIM_PID" 2> /dev/null || true
        wait "$DEVSIM_PID" 2> /dev/null || true
        DEVSIM_PID=
    fi
    # A killed emulator can leave its mount behind.
    if grep -qs " $DEV fuse" /proc/mounts; then
        fusermount3 -u -z "$DEV" 2> /dev/null || umount -l "$DEV" 2> /dev/null || true
    fi
}
stop_all() {
    stop_processes
    if [ "${ORVANE_DEMO_KEEP:-0}" = 1 ]; then
        echo "sandbox kept: $SANDBOX"
    else
        rm -rf "$SANDBOX"
    fi
}
trap stop_all EXIT

# Waits up to $1 seconds for the command after it to succeed.
wait_for() {
    local bound=$(($1 * 10))
    shift
    for ((i = 0; i < bound; i++)); do
        "$@" && return 0
        sleep 0.1
    done
    return 1
}

section() { printf '\n== %s\n' "$*"; }

# True once event.db holds a row of the event id $1.
event_stored() {
    [ "$(sqlite3 "$DB" "select count(*) from event_info where event_id = $1;" 2> /dev/null)" != 0 ]
}

# Log collection on a host: cloud copies of the log rules, with sources that exist on Linux and
# in the sandbox, and of the privacy policy, which also lets in the sandbox's log folders (the
# folder "private" stays out, so one source of the wlan rule is refused).
LOGS=$SANDBOX/logs
write_log_rules() {
    mkdir -p "$LOGS/wlan" "$LOGS/tombstones" "$SANDBOX/private"
    echo "firmware state: halted at 0x1c2f" > "$LOGS/wlan/fw_state.txt"
    for n in 1 2 3; do
        head -c $((n * 40000)) /dev/urandom > "$LOGS/wlan/fw_dump_$n.bin"
        touch -d "-$((4 - n)) min" "$LOGS/wlan/fw_dump_$n.bin"
    done
    for n in 00 01 02; do
        printf 'pid: 42%s, name: com.android.phone\nsignal 11 (SIGSEGV)\n' "$n" > "$LOGS/tombstones/tombstone_$n"
    done
    echo "ssid=home psk=secret" > "$SANDBOX/private/wifi_passwords.txt"
    # Host paths for the rules; the subscriptions are the shipped ones.
    cat > "$SANDBOX/cloud/event_upload.xml" << EOF
<EventUpload>
  <LogRule eventMin="901000000" eventMax="901999999">
    <Static path="/proc/version"/>
    <Command cmd="uname -a" timeoutSec="5" file="uname.txt"/>
  </LogRule>
  <LogRule eventId="901001001">
    <Static path="$LOGS/wlan/fw_state.txt"/>
    <Static path="$SANDBOX/private/wifi_passwords.txt"/>
    <Dynamic dir="$LOGS/wlan" pattern="fw_dump_\d+\.bin" count="2" maxAgeSec="3600" delete="true"/>
    <Command cmd="uname -a" timeoutSec="5" file="uname.txt"/>
  </LogRule>
  <LogRule eventMin="902000000" eventMax="902999999">
    <Dynamic dir="$LOGS/tombstones" pattern="tombstone_\d{2}" count="2"/>
    <Command cmd="ps -e -o pid,comm" timeoutSec="5" file="ps.txt"/>
  </LogRule>
  <LogRule eventMin="905000000" eventMax="905999999">
    <Static path="/proc/diskstats"/>
    <Command cmd="df -k" timeoutSec="5" file="df.txt"/>
  </LogRule>
  <LogRule eventMin="909000000" eventMax="909999999">
    <Static path="/proc/loadavg"/>
    <Static path="/proc/meminfo"/>
  </LogRule>
$(grep '<Subscribe ' "$ROOT/etc/event_upload.xml")
</EventUpload>
EOF
    sed "s|<LogPaths>|<LogPaths><Allow prefix=\"$LOGS/\"/><Allow prefix=\"$WORK/\"/>|" \
        "$ROOT/etc/privacy_policy.xml" > "$SANDBOX/cloud/privacy_policy.xml"
    # A policy's key file lies beside it.
    cp "$ROOT/etc/privacy_server_key.pem" "$SANDBOX/cloud/"
}

section "sandbox $SANDBOX"
# Performance events: where this kernel takes pressure stall triggers, the demo loads
# PerfLogAnalyzer 2 s after start instead of 30 and lets it fire on moderate CPU pressure (cloud
# copies of the plugin configuration and of perf_config.xml, which take precedence).
PERF=0
PERF_PROBE=$("$BUILD/orvane-pressure" probe 2>&1) && PERF=1
if [ "$MODE" = demo ] && [ "$PERF" = 1 ]; then
    sed 's/^PerfLogAnalyzer\(.*\):30 static/PerfLogAnalyzer\1:2 static/' "$ROOT/etc/plugin_config" > "$SANDBOX/cloud/plugin_config"
    cat > "$SANDBOX/cloud/perf_config.xml" <<'EOF'
<PerfConfig>
  <Resource name="cpu" someStallUs="200000" windowUs="2000000" coolDownSec="600" topCount="5"/>
</PerfConfig>
EOF
fi
if [ "$MODE" = demo ]; then
    write_log_rules
fi
"$BUILD/orvane-devsim" "$DEV" 2> "$SANDBOX/devsim.log" &
DEVSIM_PID=$!
if ! wait_for 10 test -e "$DEV/qxev"; then
    echo "demo: the device emulator did not start:" >&2
    cat "$SANDBOX/devsim.log" >&2
    exit 1
fi
echo "device nodes emulated: $DEV/qxev $DEV/qx_exception_log"

"$BUILD/orvane" -configDir "$ROOT/etc" -workDir "$WORK" -cloudCfgDir "$SANDBOX/cloud" \
    -devList "qxev=$DEV/qxev,qx_exception_log=$DEV/qx_exception_log" > "$SANDBOX/orvane.log" 2>&1 &
DAEMON_PID=$!
LOG=$SANDBOX/orvane.log
# The sources are running once the daemon holds both nodes open.
sources_open() {
    local fds
    fds=$(ls -l "/proc/$DAEMON_PID/fd" 2> /dev/null) || return 1
    [[ $fds == *"$DEV/qxev"* && $fds == *"$DEV/qx_exception_log"* ]]
}
if ! wait_for 20 sources_open; then
    echo "demo: the daemon did not open the device nodes; the end of its log:" >&2
    tail -n 30 "$LOG" >&2
    exit 1
fi
echo "daemon running (pid $DAEMON_PID), log: $LOG"

# The demonstration: a realistic stream of kernel records, then what became of them.
run_demo() {
    # The record stream. Happen times are the kernel's stamps in seconds; they are placed within
    # today so that the day's counters apply.
    MIDNIGHT=$(date -d 'today 00:00' +%s)
    QXEV=$DEV/qxev
    FAULTS=0
    record() { # id time params: one write is one record, as a driver hands it over
        printf 'EventId %s -t %s -paraList %s' "$1" "$2" "$3" > "$QXEV"
    }
    fault() { # a record whose id lies in the fault ranges, which storage counts
        record "$@"
        FAULTS=$((FAULTS + 1))
    }

    section "writing kernel records"
    # Faults of three domains (kernel 901, framework 902, storage 905), well spaced, within quota.
    fault 901001001 $((MIDNIGHT + 3600)) '{"reason":"wlan firmware crash","uptime":5120}'
    fault 901001002 $((MIDNIGHT + 3700)) '{"task":"kworker/2:1","blockedSec":120}'
    fault 905001001 $((MIDNIGHT + 3900)) '{"device":"sda","errno":5,"sector":123456}'
    fault 905001001 $((MIDNIGHT + 9000)) '{"device":"sda","errno":5,"sector":123456}'
    echo "4 faults of the kernel and storage domains"

    # The privacy policy at work (the upload switch is on: the user agreed to uploads).
    # A crash report with a stack longer than the catalogue's 256 bytes and a member the
    # catalogue does not list: stored cut, without the member.
    local stack="java.lang.NullPointerException: Attempt to invoke a virtual method on a null object reference"
    stack="$stack$(printf ' at com.android.phone.CallNotifier.onNewRingingConnection(CallNotifier.java:%d)' 101 102 103)"
    fault 902001001 $((MIDNIGHT + 3800)) '{"pkg":"com.android.phone","versionCode":33,"exception":"'"$stack"'","userName":"alice"}'
    # An ANR of the contacts provider, which the filter list names: dropped.
    fault 902001002 $((MIDNIGHT + 3850)) '{"pkg":"com.android.providers.contacts","anrReason":"Input dispatching timed out"}'
    # A storage health report with the chip's serial number, an identifier: sealed for the server.
    fault 905002001 $((MIDNIGHT + 3950)) '{"device":"ufs0","lifeUsed":30,"serial":"UFS-0042-7731"}'
    echo "3 faults for the privacy policy: one to cut, one of a filtered package, one with an identifier"

    # The same wlan crash again and again, two hours apart: each opens a new hour period, so only
    # its daily quota (3 in event_quota.xml) stops it.
    for hour in 3 5 7 9 11 13 15 17; do
        fault 901001001 $((MIDNIGHT + hour * 3600)) '{"reason":"wlan firmware crash","uptime":5120}'
    done
    echo "8 more wlan crashes, two hours apart (daily quota 3)"

    # An ANR storm: 30 reports within two seconds. The first ones of the hour pass; the rest come
    # too close together under the pacing rule.
    for i in $(seq 1 30); do
        fault 902001002 $((MIDNIGHT + 20000 + i / 15)) '{"pkg":"com.example.maps","anrReason":"input dispatching timed out"}'
    done
    echo "30 ANRs of one app within two seconds (pacing)"

    # Malformed and foreign records: each is dropped by the source or ignored by storage.
    printf 'EventId 0 -t %s -paraList {}' "$MIDNIGHT" > "$QXEV"
    printf 'EventId -5 -t %s -paraList {}' "$MIDNIGHT" > "$QXEV"
    printf 'no keywords at all' > "$QXEV"
    printf 'EventId 901001001 -t' > "$QXEV"
    printf '\x01\x02\xff\xfe binary garbage' > "$QXEV"
    MALFORMED=5
    record 123 $((MIDNIGHT + 100)) '{"not":"a fault id"}'
    echo "$MALFORMED malformed records and 1 record with an id outside the fault ranges"

    # The exception log channel: forwarded as event 902902 with the record unparsed.
    printf 'kernel BUG at mm/slub.c:420 pid=1234\n' > "$DEV/qx_exception_log"
    echo "1 exception log record (event 902902: outside the fault ranges, so not stored)"

    section "waiting for the daemon to handle them"
    DB=$WORK/event.db
    # The database keeps a write-ahead log, so reading it while the daemon runs never holds up
    # the daemon's writes.
    drops() { # events the privacy policy or the quotas dropped, from the daemon's statistics
        "$BUILD/orvanectl" --workdir "$WORK" dump stats 2> /dev/null |
            awk '$1 ~ /^(privacy|storage\.events)\.dropped\./ {n += $2} END {print n + 0}'
    }
    stored() { # kept fault occurrences of the domains written above
        sqlite3 "$DB" "select coalesce(sum(occured_cnt), 0) from event_info
                       where event_id between 901000000 and 905999999;" 2> /dev/null || echo 0
    }
    # Every fault record ends stored (counted in occured_cnt) or dropped with a logged reason.
    settled() { [ $(($(stored) + $(drops))) -ge "$FAULTS" ]; }
    if wait_for 30 settled; then
        echo "all $FAULTS fault records were stored or dropped"
    else
        echo "after 30 s only $(($(stored) + $(drops))) of $FAULTS fault records were stored or dropped"
    fi

    run_eventinfo_demo
    run_log_demo

    if [ -x "$BUILD/orvanectl" ] && [ -S "$WORK/orvane.sock" ]; then
        section "orvanectl dump plugin EventStorageManager query event_daily"
        "$BUILD/orvanectl" --workdir "$WORK" dump plugin EventStorageManager query event_daily || true
        section "orvanectl dump plugin EventPrivacyCompliance"
        "$BUILD/orvanectl" --workdir "$WORK" dump plugin EventPrivacyCompliance || true
        section "orvanectl dump stats"
        "$BUILD/orvanectl" --workdir "$WORK" dump stats | tee "$SANDBOX/stats.txt" || true
    fi

    run_perf_demo
    run_log_filter_demo

    section "stopping the daemon and the emulator"
    stop_processes
    echo "stopped"

    section "stored events per id (event_info)"
    sqlite3 -header -column "$DB" \
        "select event_id, count(*) as rows, sum(occured_cnt) as occurrences from event_info group by event_id order by event_id;"
    echo "(908001001 is the daemon's own report of an event that went over its daily quota)"

    section "what the privacy policy did"
    echo "902001001 as written:"
    echo "  {\"pkg\":\"com.android.phone\",\"versionCode\":33,\"exception\":\"(${#stack} bytes)\",\"userName\":\"alice\"}"
    echo "902001001 as stored (exception cut to 256 bytes, userName removed):"
    sqlite3 "$DB" "select '  ' || param_list from event_info where event_id = 902001001;"
    echo "902001002 of com.android.providers.contacts: $(grep -o "event 902001002 dropped by [a-z_.]*" "$LOG" | head -1)"
    echo "  stored rows of it: $(sqlite3 "$DB" "select count(*) from event_info where event_id = 902001002
        and param_list like '%providers.contacts%';")"
    echo "905002001 as stored (serial sealed for the upload server):"
    sqlite3 "$DB" "select '  ' || param_list from event_info where event_id = 905002001;"

    if [ "$PERF" = 1 ]; then
        section "the performance event (909001001: CPU pressure, its figures and the busiest processes)"
        sqlite3 "$DB" "select param_list from event_info where event_id = 909001001 limit 1;"
    fi

    section "the log filter statistics (908002001) of the stand-in logcat -S"
    sqlite3 "$DB" "select param_list from event_info where event_id = 908002001 limit 1;"

    section "today's counters (event_daily)"
    sqlite3 -header -column "$DB" \
        "select event_id, daily_cnt, over_cnt, hour_cnt from event_daily order by event_id;"

    section "drops and their reasons (from the daemon's statistics)"
    sqlite3 "$DB" "select '  ' || event_id || ': ' || over_cnt || ' dropped over its daily quota or by the hourly pacing'
                   from event_daily where over_cnt > 0 order by event_id;"
    [ -f "$SANDBOX/stats.txt" ] && awk '
        $1 == "storage.events.dropped.over_daily_quota" { printf "%6d x over daily quota\n", $2 }
        $1 == "storage.events.dropped.punished" { printf "%6d x event happen too sequence, drop it by punish\n", $2 }
        $1 ~ /^privacy\.dropped\./ && $2 > 0 {
            sub(/^privacy\.dropped\./, "", $1); printf "%6d x dropped by the privacy policy (%s)\n", $2, $1 }
        $1 ~ /^source\.EventRadiator\.rejected\./ { rejected += $2 }
        END { printf "%6d records rejected by the source as invalid\n", rejected }' "$SANDBOX/stats.txt"
}

# The log packs of the faults above, the switch off, a full domain trimmed, and the hand-over.
run_log_demo() {
    local ctl=("$BUILD/orvanectl" --workdir "$WORK")
    packs() { find "$WORK" -name 'EventId_*.zip' | wc -l; }
    more_packs() { [ "$(packs)" -gt "$1" ]; }
    pack_of() { [ -n "$(find "$WORK/$1" -name "EventId_*_$2.zip" 2> /dev/null)" ]; }
    handed_over() { [ -z "$(find "$WORK" -maxdepth 2 -name 'EventId_*.zip' -not -path '*/ue_off/*')" ]; }
    section "log packs of the faults above"
    # One pack each of 901001001, 901001002, 902001001, 902001002, 905001001 and 905002001.
    wait_for 30 more_packs 5 || echo "only $(packs) packs after 30 s"
    find "$WORK" -name 'EventId_*.zip' -printf '  %P  %s bytes\n' | sort
    local wlan
    wlan=$(find "$WORK/901" -maxdepth 1 -name 'EventId_*_901001001.zip' | head -n 1)
    echo "contents of the wlan crash's pack (unzip -l):"
    [ -n "$wlan" ] && unzip -l "$wlan" | sed 's/^/  /'
    echo "the sub-domain's logSpace (60 KiB) at work:"
    grep -oE "PackLogToZip event 901001001: .*(cut to|left out).*" "$LOG" | sed 's/^PackLogToZip /  /' || true
    echo "sources refused by the privacy policy: $(grep -c "a log file was refused" "$LOG" || true)" \
        "(private/wifi_passwords.txt lies outside the allowed folders)"
    echo "firmware dumps left after packing (the rule deletes what it packed): $(ls "$LOGS/wlan" | tr '\n' ' ')"
    echo "faults without a pack because logs of their id were caught too recently:"
    grep -o "CheckIfNeedProcessLog .*" "$LOG" | head -n 3 | sed 's/^/  /' || true
    "${ctl[@]}" dump stats | grep -E "^(logproc|privacy\.path)\." | sed 's/^/  /'

    section "upload switch off: the next pack goes to ue_off"
    "${ctl[@]}" upload-switch off
    wait_for 5 grep -q "persist.sys.orvane.upload_switch=0" "$ORVANE_PROPERTY_FILE" || true
    printf 'EventId 909001100 -t %s -paraList {}' $((MIDNIGHT + 30000)) > "$QXEV"
    wait_for 20 pack_of 909/ue_off 909001100 || echo "no pack within 20 s"
    find "$WORK/909" -name 'EventId_*.zip' -printf '  %P\n'
    "${ctl[@]}" upload-switch on
    wait_for 5 grep -q "persist.sys.orvane.upload_switch=1" "$ORVANE_PROPERTY_FILE" || true

    section "the kernel sub-domain is full (2 packs): the next pack first trims it to half"
    printf 'EventId 901001100 -t %s -paraList {}' $((MIDNIGHT + 31000)) > "$QXEV"
    wait_for 20 grep -q "CheckAndClearLogFolder domain" "$LOG" || echo "no trim within 20 s"
    grep -o "CheckAndClearLogFolder domain.*" "$LOG" | tail -n 1 | sed 's/^/  /'
    wait_for 20 pack_of 901 901001100 || echo "no pack within 20 s"
    find "$WORK/901" -maxdepth 1 -name 'EventId_*.zip' -printf '  %P\n' | sort

    section "orvanectl pack-log"
    "${ctl[@]}" pack-log
    wait_for 10 handed_over || echo "not everything was handed over within 10 s"
    wait_for 10 test -e "$WORK/uploading/eventinfo.901" || echo "eventinfo.901 was not handed over within 10 s"
    echo "the work folder afterwards (packs made while the switch was off stay in ue_off):"
    (cd "$WORK" && find . -name 'EventId_*' -o -name 'eventinfo.*' -o -type d | sort | sed 's/^/  /')
    "${ctl[@]}" dump plugin EventInfoPack | grep '^domain' | sed 's/^/  /' || true
}

# Records of subscribed events (event_upload.xml subscribes the kernel domain 901 and 902001001,
# 905001001); "pack-log" in the log demo hands them over.
run_eventinfo_demo() {
    section "a subscribed event's record (first line of $WORK/eventinfo.901)"
    if ! wait_for 10 test -s "$WORK/eventinfo.901"; then
        echo "no record of domain 901 within 10 s"
        return
    fi
    head -n 1 "$WORK/eventinfo.901"
    echo "(serialNo is the serial number DEMO0001 sealed for the upload server; records per file:"
    for file in "$WORK"/eventinfo.*; do echo "  $(basename "$file"): $(wc -l < "$file")"; done
    echo ")"
    section "orvanectl dump plugin EventInfoPack"
    "$BUILD/orvanectl" --workdir "$WORK" dump plugin EventInfoPack || true
}

# CPU pressure from orvane-pressure until the kernel's trigger fires and the event is stored.
run_perf_demo() {
    section "performance event: CPU pressure"
    if [ "$PERF" != 1 ]; then
        echo "skipped: this kernel takes no pressure stall trigger here ($(echo "$PERF_PROBE" | head -n 1))"
        return
    fi
    perf_watching() { "$BUILD/orvanectl" --workdir "$WORK" dump plugin PerfLogAnalyzer 2> /dev/null | grep -q "armed"; }
    if ! wait_for 20 perf_watching; then
        echo "PerfLogAnalyzer did not arm its trigger; the end of the daemon's log:"
        tail -n 10 "$LOG"
        return
    fi
    "$BUILD/orvane-pressure" cpu 40 > "$SANDBOX/pressure.log" 2>&1 &
    PRESSURE_PID=$!
    echo "orvane-pressure cpu: two spinning threads per CPU at the lowest priority, at most 40 s"
    if wait_for 40 event_stored 909001001; then
        echo "the trigger fired and event 909001001 was stored"
    else
        echo "no performance event within 40 s"
    fi
    kill "$PRESSURE_PID" 2> /dev/null || true
    wait "$PRESSURE_PID" 2> /dev/null || true
    PRESSURE_PID=
    section "orvanectl dump plugin PerfLogAnalyzer"
    "$BUILD/orvanectl" --workdir "$WORK" dump plugin PerfLogAnalyzer || true
}

# One run of RunLogManager now instead of 180 s after start: the stand-in's statistics become
# event 908002001 in dftFaultEvent.
run_log_filter_demo() {
    section "log filter statistics: orvanectl dump plugin RunLogManager run"
    "$BUILD/orvanectl" --workdir "$WORK" dump plugin RunLogManager run || return 0
    if wait_for 20 event_stored 908002001; then
        echo "event 908002001 was stored"
    else
        echo "no log filter event within 20 s"
    fi
    "$BUILD/orvanectl" --workdir "$WORK" dump plugin RunLogManager || true
}

# Load figures: end-to-end throughput with few and with many distinct ids, then the latency
# from the write on the node to the commit at a steady 100 events a second.
run_load() {
    local seconds=$1
    [ -x "$BUILD/orvane-loadgen" ] || { echo "demo: $BUILD/orvane-loadgen is missing" >&2; exit 1; }
    local results=$SANDBOX/load.txt
    section "throughput, 50 distinct ids (most dropped by quota), ${seconds} s"
    "$BUILD/orvane-loadgen" throughput "$DEV/qxev" "$WORK" "$DAEMON_PID" 50 "$seconds" | tee -a "$results"
    section "throughput, 5000 distinct ids (mostly stored), ${seconds} s"
    "$BUILD/orvane-loadgen" throughput "$DEV/qxev" "$WORK" "$DAEMON_PID" 5000 "$seconds" | tee -a "$results"
    # The same ids again under a cloud quota that keeps every event of their domain, so the rate
    # of stored events is the store's speed and not the quotas' allowance.
    sed 's|<unknown>|<unknown><Domain name="load" eventMin="903000000" eventMax="903999999" dailyCnt="100000000"/>|' \
        "$ROOT/etc/event_quota.xml" > "$SANDBOX/cloud/event_quota.xml"
    # Announced, as the companion app announces what it pushes: the next event sees the new copy.
    "$BUILD/orvanectl" --workdir "$WORK" config-update "$SANDBOX/cloud/" > /dev/null
    section "throughput, 5000 distinct ids, every event stored (cloud quota), ${seconds} s"
    "$BUILD/orvane-loadgen" throughput "$DEV/qxev" "$WORK" "$DAEMON_PID" 5000 "$seconds" | tee -a "$results"
    rm "$SANDBOX/cloud/event_quota.xml"
    "$BUILD/orvanectl" --workdir "$WORK" config-update "$SANDBOX/cloud/" > /dev/null
    section "latency from write to commit at 100 events/s, 20 s"
    "$BUILD/orvane-loadgen" latency "$DEV/qxev" "$WORK" 100 20 | tee -a "$results"
    section "stopping the daemon and the emulator"
    stop_processes
    section "nothing lost: $(grep -o 'written=[0-9]*' "$results" | awk -F= '{n += $2} END {print n}') records written"
    sqlite3 -header -column "$WORK/event.db" \
        "select (select coalesce(sum(occured_cnt), 0) from event_info where event_id between 903000000 and 904999999)
                as stored,
                (select coalesce(sum(over_cnt), 0) from event_daily where event_id between 903000000 and 904999999)
                as dropped;"
}

# Memory under a flood: records written by four writers as fast as the node takes them; the
# daemon's resident memory before, at its peak (VmHWM) and once it has gone idle.
run_flood() {
    [ -x "$BUILD/orvane-loadgen" ] || { echo "demo: $BUILD/orvane-loadgen is missing" >&2; exit 1; }
    section "flood of $1 records of $2 bytes, 4 writers"
    "$BUILD/orvane-loadgen" flood "$DEV/qxev" "$DAEMON_PID" 50 "$1" "$2" 4
    if [ -x "$BUILD/orvanectl" ] && [ -S "$WORK/orvane.sock" ]; then
        section "the daemon's counters"
        "$BUILD/orvanectl" --workdir "$WORK" dump stats | grep -E "^(source|pipeline)\." || true
    fi
}

case "$MODE" in
    demo) run_demo ;;
    load) run_load "$LOAD_SECONDS" ;;
    flood) run_flood "$FLOOD_RECORDS" "$FLOOD_BYTES" ;;
esac
