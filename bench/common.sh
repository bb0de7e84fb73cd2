# Shared by the whole-process benchmarks (sourced): the 10-minute 720p30 4 Mbit/s H.264 + AAC
# clip both the recorder and ffmpeg's segmenter read, and small measuring helpers.
#
# bench_clip BUILD_DIR   prints the clip's path; makes it once (a minute or two) with the
#                        ffmpeg CLI in BUILD_DIR/bench-media.
# bench_measure OUT CMD  runs CMD with its output discarded and appends "cpu_seconds
#                        peak_rss_kib" (user + system) of that run to OUT.
# median                 the median of the numbers on stdin, one a line.

bench_clip() {
  local media=$1/bench-media
  local clip=$media/in.ts
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
  echo "$clip"
}

bench_measure() {
  local out=$1
  shift
  local t
  t=$(mktemp)
  /usr/bin/time -f '%U %S %M' -o "$t" "$@" >/dev/null 2>&1 || true
  awk '{ printf "%.3f %d\n", $1 + $2, $3 }' "$t" >>"$out"
  rm -f "$t"
}

median() { sort -n | awk '{ v[NR] = $1 } END { print v[int((NR + 1) / 2)] }'; }
