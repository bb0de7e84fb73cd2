#!/usr/bin/env bash
# Whole-process comparison with the plain segmenter: CPU seconds (user + system) and peak RSS of
#   the recorder  recording a 10-minute 4 Mbit/s 720p30 H.264 + AAC clip into the local
#                 directory store at -readrate 30, and of
#   ffmpeg        -v error -i in.ts -c copy -f segment -segment_time 10 out%03d.ts, unpaced
#                 and at -readrate 30,
# on the same file, five runs each (RUNS); prints the medians and the ratios as a Markdown table.
# A recorder run whose log reports "queue overflow" is flagged: it dropped samples.
#
# Usage: bench/compare_segmenter.sh [BUILD_DIR]   (default build-bench; the clip is cached
# in BUILD_DIR/bench-media, made once with the ffmpeg CLI in a minute or two)
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build-bench}
recorder=$build/stream-file-recorder
runs=${RUNS:-5}
. bench/common.sh
clip=$(bench_clip "$build")

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
overflow=0

: >"$work/recorder" && : >"$work/ffmpeg" && : >"$work/ffmpeg30"
for i in $(seq "$runs"); do
  rm -rf "$work/store" "$work/segments"
  mkdir -p "$work/store/bench" "$work/segments"
  AWS_EC2_METADATA_DISABLED=true bench_measure "$work/recorder" "$recorder" -input "$clip" \
    -uploadinterval 10 -bufferfullsize 3 -authretrytime 3000 -kct h264 -bucketname bench -endpoint "file://$work/store" -readrate 30 \
    -status /dev/null -logfile "$work/log"
  if grep -q "queue overflow" "$work/log"; then overflow=$((overflow + 1)); fi
  objects=$(find "$work/store/bench" -name '*.ts' | wc -l)
  rm -f "$work/log"
  bench_measure "$work/ffmpeg" ffmpeg -v error -i "$clip" -c copy -f segment -segment_time 10 \
    "$work/segments/out%03d.ts"
  rm -rf "$work/segments" && mkdir -p "$work/segments"
  bench_measure "$work/ffmpeg30" ffmpeg -v error -readrate 30 -i "$clip" -c copy -f segment \
    -segment_time 10 "$work/segments/out%03d.ts"
  echo "run $i: recorder $(tail -1 "$work/recorder") ($objects objects)," \
    "ffmpeg $(tail -1 "$work/ffmpeg"), ffmpeg -readrate 30 $(tail -1 "$work/ffmpeg30")" >&2
done

rc=$(cut -d' ' -f1 "$work/recorder" | median)
rm_=$(cut -d' ' -f2 "$work/recorder" | median)
fc=$(cut -d' ' -f1 "$work/ffmpeg" | median)
fm=$(cut -d' ' -f2 "$work/ffmpeg" | median)
f3c=$(cut -d' ' -f1 "$work/ffmpeg30" | median)
f3m=$(cut -d' ' -f2 "$work/ffmpeg30" | median)
echo
echo "Whole process, 10 min 720p30 4 Mbit/s H.264 + AAC, medians of $runs runs:"
echo
echo "| | CPU seconds | peak RSS (MiB) |"
echo "|---|---|---|"
awk -v rc="$rc" -v rm="$rm_" -v fc="$fc" -v fm="$fm" -v f3c="$f3c" -v f3m="$f3m" 'BEGIN {
  printf "| recorder (-readrate 30, local store) | %.2f | %.1f |\n", rc, rm / 1024
  printf "| ffmpeg -c copy -f segment | %.2f | %.1f |\n", fc, fm / 1024
  printf "| ffmpeg -readrate 30 -c copy -f segment | %.2f | %.1f |\n", f3c, f3m / 1024
  printf "| ratio to ffmpeg | %.2f | %.2f |\n", rc / fc, rm / fm
  printf "| ratio to ffmpeg -readrate 30 | %.2f | %.2f |\n", rc / f3c, rm / f3m
}'
echo
echo "recorder runs with \"queue overflow\": $overflow of $runs"
