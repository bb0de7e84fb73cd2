#!/usr/bin/env bash
# Real-time scale comparison on one machine: N recorders reading the clip at -readrate 1 side by
# side for DURATION seconds, then N `ffmpeg -re -i in.ts -c copy -f segment -segment_time 10`
# side by side for as long, both writing into tmpfs (/dev/shm). Prints, as a Markdown table:
#   CPU per stream    user + system seconds of each process, averaged, and the ratio;
#   RSS per process   median peak RSS and the ratio;
#   queue overflow    "queue overflow" lines in all the recorders' logs;
#   late cuts         objects whose duration is not the 10 s interval within 2 frames (the
#                     last object of each stream, cut when the input ends, excepted);
#   latency           from the arrival of the IDR that begins the next object (its "IDR:" log
#                     line, written by the video worker) to the object's LastSequenceNumNotify
#                     status line (written once the object is visible in the store): median, max.
# The load average at the start is printed with the figures: on a shared machine they vary.
#
# Usage: N=50 DURATION=40 bench/scale.sh [BUILD_DIR]   (default build-bench)
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build-bench}
n=${N:-50}
duration=${DURATION:-40}
recorder=$(realpath "$build/stream-file-recorder")
. bench/common.sh
clip=$(realpath "$(bench_clip "$build")")

work=$(mktemp -d /dev/shm/sfr-scale.XXXXXX)
cleaner=
trap '[ -n "$cleaner" ] && kill "$cleaner" 2>/dev/null; rm -rf "$work"' EXIT

# Removes the stored objects and segments a few seconds after they appear, so that the tmpfs
# holds only what is being written (the figures come from the status lines and the logs).
clean_loop() {
  local seen=$work/seen
  : >"$seen"
  while sleep 5; do
    xargs -r rm -f <"$seen" 2>/dev/null || true
    find "$work" -name '*.ts' >"$seen" 2>/dev/null || true
  done
}

echo "N = $n streams, $duration s each; $(nproc) cores; load at start: $(cut -d' ' -f1-3 /proc/loadavg)" >&2
clean_loop &
cleaner=$!

# The recorders, started 20 ms apart so that their opening steps do not all coincide.
pids=()
for i in $(seq "$n"); do
  d=$work/rec/$i
  mkdir -p "$d/store/bench"
  AWS_EC2_METADATA_DISABLED=true bench_measure "$work/recorder.cpu" "$recorder" -input "$clip" \
    -streamingid "s$i" -uploadinterval 10 -bufferfullsize 3 -authretrytime 3000 -kct h264 \
    -bucketname bench -endpoint "file://$d/store" -readrate 1 -duration "$duration" \
    -status "$d/status.jsonl" -logfile "$d/log" &
  pids+=($!)
  sleep 0.02
done
wait "${pids[@]}"

pids=()
for i in $(seq "$n"); do
  d=$work/ff/$i
  mkdir -p "$d"
  bench_measure "$work/ffmpeg.cpu" ffmpeg -v error -re -i "$clip" -t "$duration" -c copy \
    -f segment -segment_time 10 "$d/out%03d.ts" &
  pids+=($!)
  sleep 0.02
done
wait "${pids[@]}"

python3 - "$work" "$n" <<'PY'
import datetime, json, re, statistics, sys
work, n = sys.argv[1], int(sys.argv[2])
frame_ms, interval_ms = 1000 / 30, 10000

def cpu_rss(path):
    rows = [line.split() for line in open(path) if line.strip()]
    return [float(r[0]) for r in rows], [int(r[1]) for r in rows]

rec_cpu, rec_rss = cpu_rss(f"{work}/recorder.cpu")
ff_cpu, ff_rss = cpu_rss(f"{work}/ffmpeg.cpu")
overflow = late = objects = 0
latencies = []
idr = re.compile(r"^(\S+ \S+) \[\d+\] <\d+> IDR: (\d+)$")
for i in range(1, n + 1):
    d = f"{work}/rec/{i}"
    idrs = []  # (rtpTime in 90 kHz, arrival in s since the epoch)
    for line in open(f"{d}/log", errors="replace"):
        overflow += "queue overflow" in line
        m = idr.match(line.rstrip("\n"))
        if m:
            t = datetime.datetime.strptime(m.group(1), "%Y-%m-%d %H:%M:%S.%f").timestamp()
            idrs.append((int(m.group(2)), t))
    stored = []  # (sequence number, duration ms, status time)
    for line in open(f"{d}/status.jsonl"):
        msg = json.loads(line)
        if msg["message"] != "LastSequenceNumNotify":
            continue
        t = datetime.datetime.strptime(msg["time"], "%Y-%m-%dT%H:%M:%S.%fZ")
        t = t.replace(tzinfo=datetime.timezone.utc).timestamp()
        for e in msg["entries"]:
            if e["succeeded"]:
                stored.append((e["sequenceNumber"], e["duration"], t))
    stored.sort()
    objects += len(stored)
    if not idrs:
        continue
    end = idrs[0][0]  # the first object begins at the first IDR
    for seq, dur, t in stored[:-1]:  # the last one is cut when the input ends
        late += abs(dur - interval_ms) > 2 * frame_ms
        end += dur * 90
        rtp, arrived = min(idrs, key=lambda x: abs(x[0] - end))
        if abs(rtp - end) <= 2 * frame_ms * 90:
            latencies.append(t - arrived)

def row(name, value, ratio=""):
    print(f"| {name} | {value} | {ratio} |")

rc, fc = sum(rec_cpu) / len(rec_cpu), sum(ff_cpu) / len(ff_cpu)
rm, fm = statistics.median(rec_rss), statistics.median(ff_rss)
print()
print(f"| N = {n}, {len(rec_cpu)} recorders / {len(ff_cpu)} ffmpeg | recorder (ffmpeg) | ratio |")
print("|---|---|---|")
row("CPU s per stream", f"{rc:.2f} ({fc:.2f})", f"{rc / fc:.2f}")
row("peak RSS MiB per process (median)", f"{rm / 1024:.1f} ({fm / 1024:.1f})", f"{rm / fm:.2f}")
row("objects stored", objects)
row('"queue overflow" lines', overflow)
row("late cuts", late)
if latencies:
    row("latency s, median / max", f"{statistics.median(latencies):.3f} / {max(latencies):.3f}",
        f"{len(latencies)} objects")
PY
