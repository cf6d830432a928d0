#!/bin/sh
# Builds the service request fuzzer with clang (libFuzzer, ASan, UBSan) and runs it for a
# bounded time. Usage: run_request_fuzzer.sh [SECONDS] [OUTPUT_DIR]
# Exit status: 0 when no crash was found in the time given.
set -eu
SECONDS_TO_RUN=${1:-60}
OUT=${2:-/tmp/orvane_request_fuzzer}
ROOT=$(cd "$(dirname "$0")/../.." && pwd)
AOSP=/usr/lib/$(gcc -print-multiarch)/android

mkdir -p "$OUT/corpus"
clang++ -std=c++17 -g -O1 -fsanitize=fuzzer,address,undefined -fno-sanitize-recover=undefined \
    -I"$ROOT" -isystem /usr/include/android \
    "$ROOT/tools/fuzz/request_decoder_fuzzer.cpp" "$ROOT/host/service/host_binder.cpp" \
    "$ROOT/host/service/host_binder_server.cpp" "$ROOT/service/IOrvaneNativeService.cpp" \
    "$AOSP/libutils.so" "$AOSP/liblog.so" "$AOSP/libcutils.so" -Wl,-rpath,"$AOSP" -lpthread \
    -o "$OUT/request_decoder_fuzzer"

# Seeds: one well-formed request of each kind, so the search starts past the interface check.
python3 - "$OUT/corpus" <<'PY'
import struct, sys, os
def s16(text):
    units = text.encode('utf-16-le')
    body = struct.pack('<i', len(units) // 2) + units + b'\0\0'
    return body + b'\0' * (-len(body) % 4)
token = struct.pack('<iii', 0, -1, 0x53595354) + s16('android.Orvane.IOrvaneNativeService')
def frame(code, data):
    return struct.pack('<III', code, 0, len(data)) + data
dump = 0x5F444D50
seeds = {
    'pack': frame(1, token),
    'runmode': frame(2, token + s16('factory') + s16('/data/x')),
    'switch': frame(3, token + struct.pack('<i', 1)),
    'config': frame(4, token + s16('/data/cloud')),
    'user': frame(5, token),
    'dump': frame(dump, struct.pack('<ii', 0, 2) + s16('plugin') + s16('EventLogProcessor')),
}
for name, data in seeds.items():
    open(os.path.join(sys.argv[1], name), 'wb').write(data)
PY

status=0
"$OUT/request_decoder_fuzzer" -max_total_time="$SECONDS_TO_RUN" -max_len=70000 -print_final_stats=1 \
    -artifact_prefix="$OUT/" "$OUT/corpus" >"$OUT/fuzz.log" 2>&1 || status=$?
tail -n 8 "$OUT/fuzz.log"
exit $status
