#!/usr/bin/env bash
# The page test: records a clip with the real binary into a local store, then plays the
# recording's live.m3u8 in headless Chromium through hls.js from a static server over the
# store, checks that video.currentTime advances, and keeps a screenshot in the build tree.
#
# Usage: tests/page/run.sh BUILD_DIR [ts|fmp4]
# hls.js is installed into BUILD_DIR/node/ (never globally) when missing; Chromium is Debian's
# `chromium` (scripts/install-deps.sh installs it).
set -euo pipefail
build=$(cd "$1" && pwd)
format=${2:-ts}
here=$(cd "$(dirname "$0")" && pwd)
version=1.7.4

prefix="$build/node"
mkdir -p "$prefix"
marker="$prefix/.hls.js-$version.installed"
if [ ! -f "$marker" ]; then
  (
    flock -w 900 9
    if [ ! -f "$marker" ]; then
      npm install --prefix "$prefix" --no-audit --no-fund --loglevel=error "hls.js@$version" >&2
      touch "$marker"
    fi
  ) 9>"$prefix/.hls.js-install.lock"
fi

work="$build/page/$format"
rm -rf "$work"
mkdir -p "$work/www/rec" "$build/page"
clip="$build/page/clip.ts"
if [ ! -s "$clip" ]; then
  ffmpeg -y -v error -f lavfi -i testsrc2=size=320x240:rate=30:duration=8 \
    -f lavfi -i sine=frequency=440:sample_rate=48000:duration=8 -pix_fmt yuv420p \
    -c:v libx264 -preset ultrafast -g 30 -keyint_min 30 -sc_threshold 0 -bf 0 \
    -c:a aac -b:a 64k "$clip.part.ts"
  mv "$clip.part.ts" "$clip"
fi
"$build/stream-file-recorder" -input "$clip" -streamingid cam1 -bucketname rec \
  -uploadinterval 2 -bufferfullsize 100 -authretrytime 3000 -kct h264 -readrate 8 \
  -segmentformat "$format" -endpoint "file://$work/www" -status /dev/null \
  -logfile "$work/log.txt"
cp "$here/index.html" "$prefix/node_modules/hls.js/dist/hls.min.js" "$work/www/"
node --experimental-websocket --no-warnings "$here/page-test.js" "$work/www" \
  "/index.html?src=rec/cam1/live.m3u8" "$build/page/screenshot-$format.png"
