#!/usr/bin/env bash
# `make run`: records a 60 s H.264 + AAC demo clip into the local directory store
# recordings/demo/ and lists the objects it stored. Expects the release build in ./build.
#
# The clip is made once with the ffmpeg CLI and kept in build/demo/. Each run stores new
# objects beside those of earlier runs (object keys carry the capture time, so they never
# collide) and lists its own. The recorder's JSON lines go to stdout, its log to stderr; the exit status is the
# recorder's.
set -euo pipefail
cd "$(dirname "$0")/.."
recorder=build/stream-file-recorder
clip=build/demo/demo.mp4

if [ ! -s "$clip" ]; then
  mkdir -p build/demo
  echo "making the 60 s demo clip $clip" >&2
  ffmpeg -y -v error \
    -f lavfi -i testsrc2=size=640x360:rate=30:duration=60 \
    -f lavfi -i sine=frequency=440:sample_rate=48000:duration=60 \
    -c:v libx264 -preset veryfast -pix_fmt yuv420p -g 60 -keyint_min 60 -sc_threshold 0 \
    -b:v 800k -c:a aac -b:a 64k "$clip.tmp.mp4"
  mv "$clip.tmp.mp4" "$clip"
fi

mkdir -p recordings/demo
marker=$(mktemp)
trap 'rm -f "$marker"' EXIT
echo "recording $clip into recordings/demo/ at 4x real time (15 s)" >&2
status=0
"$recorder" -input "$clip" -uploadinterval 10 -bufferfullsize 3 -authretrytime 3000 -kct h264 \
  -bucketname demo -endpoint "file://$PWD/recordings" -readrate 4 || status=$?

echo >&2
echo "objects this run stored in recordings/demo/ (duration in seconds):" >&2
find recordings/demo -type f -name '*.ts' -newer "$marker" -printf '%T@ %p\n' | sort -n | cut -d' ' -f2- |
  while read -r object; do
    duration=$(ffprobe -v error -show_entries format=duration -of csv=p=0 "$object" || echo "?")
    printf '%8s  %s\n' "$duration" "$object" >&2
  done
exit "$status"
