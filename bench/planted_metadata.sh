#!/usr/bin/env bash
# What the first look-up over N containers of one user and class costs the
# daemon in memory (VmRSS growth over a fresh start), for containers
#   requests   made through requests (quarter-bench --prefill)
#   expanding  planted, each metadata file 1 MiB: one string referred to
#              88 times from the info values
#   plain      planted, each metadata file 1 MiB of one string
# Usage: bench/planted_metadata.sh [BUILD_DIR] (N=10000, KINDS="requests expanding"; plain on request)
# Writes N MiB of files for each planted kind; run it where that fits.
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build}
n=${N:-10000}
kinds=${KINDS:-requests expanding}
daemon=$build/Daemon/quarterd
[ -x "$daemon" ] || daemon=$build/quarterd

rss_kib() { awk '/^VmRSS:/ { print $2 }' "/proc/$1/status"; }

start() {  # root; sets pid
  "$daemon" --root "$1" --log-level 3 &
  pid=$!
  for _ in $(seq 400); do [ -S "$1/run/com.norvane.quarterd" ] && return; sleep 0.025; done
  echo "daemon did not start" >&2; exit 1
}
stop() { kill -TERM "$pid"; wait "$pid" || true; }

plant() {  # root kind
  python3 - "$1/private/var/mobile/Containers/Data/Application" "$2" "$n" <<'PY'
import os, plistlib, sys, uuid
directory, kind, count = sys.argv[1], sys.argv[2], int(sys.argv[3])
mib = 1 << 20
for i in range(count):
    d = os.path.join(directory, str(uuid.uuid4()).upper())
    os.makedirs(d)
    if kind == "expanding":
        big = "x" * (mib - 4096)
        info = {"k%d" % k: big for k in range(88)}
    else:
        info = {"k": "x" * (mib - 4096)}
    meta = {"QRTMetadataIdentifier": "org.planted.c%d" % i, "QRTMetadataUUID": str(uuid.uuid4()).upper(),
            "QRTMetadataContentClass": 2, "QRTMetadataPersona": 501, "QRTMetadataInfo": info}
    with open(os.path.join(d, ".com.norvane.quarter_kit.metadata.plist"), "wb") as f:
        plistlib.dump(meta, f, fmt=plistlib.FMT_BINARY)
    os.chown(d, 501, 501)
PY
}

printf '%-10s %8s %12s %12s %10s\n' kind N "rss start" "rss after" "growth"
for kind in $kinds; do
  root=$(mktemp -d /tmp/quarterd-bench.XXXXXX)
  chmod 755 "$root"
  scripts/make-device-root "$root" >/dev/null
  start "$root"
  if [ "$kind" = requests ]; then
    # The look-up set of quarter-bench brings the count to N.
    "$build/tools/quarter-bench" --socket "$root/run/com.norvane.quarterd" --prefill $((n - 100)) --op lookup \
      --seconds 0.1 >/dev/null
  fi
  stop
  [ "$kind" = requests ] || plant "$root" "$kind"
  start "$root"
  before=$(rss_kib "$pid")
  "$build/tools/quarterctl" --root "$root" lookup --class 2 --user 501 --identifier org.absent >/dev/null 2>&1 || true
  after=$(rss_kib "$pid")
  printf '%-10s %8d %9d KiB %9d KiB %7d KiB\n' "$kind" "$n" "$before" "$after" $((after - before))
  stop
  rm -rf "$root"
done
