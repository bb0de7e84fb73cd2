#!/usr/bin/env bash
# Whole-process comparison with the plain segmenter: CPU seconds (user + system) and peak RSS of
#   the recorder  recording a 10-minute 4 Mbit/s 720p30 H.264 + AAC clip into the local
#                 directory store at -readrate 30, and of
#   ffmpeg        -v error -i in.ts -c copy -f segment -segment_time 10 out%03d.ts
# on the same file, five runs each; prints the medians and the ratios as a Markdown table.
# A recorder run whose log reports "queue overflow" is flagged: it dropped samples.
#
# Usage: bench/compare_segmenter.sh [BUILD_DIR]   (default build-bench; the clip is cached
# in BUILD_DIR/bench-media, made once with the ffmpeg CLI in a minute or two)
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build-bench}
recorder=$build/stream-file-recorder
runs=${RUNS:-5}
media=$build/bench-media
clip=$media/in.ts
mkdir -p "$media"
if [ ! -s "$clip" ]; then
  echo "making the 10-minute 720p30 4 Mbit/s clip $clip" >&2
  ffmpeg -y -v error \
    -f lavfi -i testsrc2=size=1280x720:rate=30:duration=600 \
    -f lavfi -i sine=frequency=440:sample_rate=48000:duration=600 \
    -c:v libx264 -preset ultrafast -pix_fmt yuv420p -b:v 4M -maxrate 4M -bufsize 4M \
    -g 60 -keyint_min 60 -sc_threshold 0 -c:a aac -b:a 128k -f mpegts "$clip.tmp"
  mv "$clip.tmp" "$clip"
fi

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
overflow=0

# Prints "cpu_seconds peak_rss_kib" of one run of the command.
measure() {
  /usr/bin/time -f '%U %S %M' -o "$work/time" "$@" >/dev/null
  awk '{ printf "%.3f %d\n", $1 + $2, $3 }' "$work/time"
}

median() { sort -n | awk '{ v[NR] = $1 } END { print v[int((NR + 1) / 2)] }'; }

: >"$work/recorder" && : >"$work/ffmpeg"
for i in $(seq "$runs"); do
  rm -rf "$work/store" "$work/segments"
  mkdir -p "$work/store/bench" "$work/segments"
  measure "$recorder" -input "$clip" -uploadinterval 10 -bufferfullsize 3 -authretrytime 3000 \
    -kct h264 -bucketname bench -endpoint "file://$work/store" -readrate 30 \
    -status /dev/null -logfile "$work/log" >>"$work/recorder"
  if grep -q "queue overflow" "$work/log"; then overflow=$((overflow + 1)); fi
  objects=$(find "$work/store/bench" -name '*.ts' | wc -l)
  rm -f "$work/log"
  measure ffmpeg -v error -i "$clip" -c copy -f segment -segment_time 10 \
    "$work/segments/out%03d.ts" >>"$work/ffmpeg"
  echo "run $i: recorder $(tail -1 "$work/recorder") ($objects objects), ffmpeg $(tail -1 "$work/ffmpeg")" >&2
done

rc=$(cut -d' ' -f1 "$work/recorder" | median)
rm_=$(cut -d' ' -f2 "$work/recorder" | median)
fc=$(cut -d' ' -f1 "$work/ffmpeg" | median)
fm=$(cut -d' ' -f2 "$work/ffmpeg" | median)
echo
echo "Whole process, 10 min 720p30 4 Mbit/s H.264 + AAC, medians of $runs runs:"
echo
echo "| | CPU seconds | peak RSS (MiB) |"
echo "|---|---|---|"
awk -v rc="$rc" -v rm="$rm_" -v fc="$fc" -v fm="$fm" 'BEGIN {
  printf "| recorder (-readrate 30, local store) | %.2f | %.1f |\n", rc, rm / 1024
  printf "| ffmpeg -c copy -f segment | %.2f | %.1f |\n", fc, fm / 1024
  printf "| ratio | %.2f | %.2f |\n", rc / fc, rm / fm
}'
echo
echo "recorder runs with \"queue overflow\": $overflow of $runs"
