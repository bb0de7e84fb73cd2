#!/usr/bin/env bash
# What a wrong secret costs: the recorder records SECONDS (default 30) of a live-paced clip into
# s3rver with a secret s3rver refuses, through a counting HTTP proxy, and prints the PUT
# requests the server got, the token requests the recorder sent, the credential answers it got
# and the size of its log at the default level.
#
# Usage: bench/storm.sh [BUILD_DIR] [SECONDS]   (default build; needs node, ffmpeg, the npm
# registry once for s3rver)
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build}
seconds=${2:-30}
recorder=$build/stream-file-recorder
work=$(mktemp -d)
pids=()
cleanup() {
  for pid in "${pids[@]}"; do kill "$pid" 2>/dev/null || true; done
  wait 2>/dev/null || true
  rm -rf "$work"
}
trap cleanup EXIT

clip=$work/clip.ts
ffmpeg -v error -f lavfi -i "testsrc2=size=320x240:rate=30:duration=$((seconds + 2))" \
  -c:v libx264 -preset ultrafast -g 30 -pix_fmt yuv420p -f mpegts "$clip"

mkfifo "$work/s3rver.in" "$work/proxy.in"
bash scripts/s3rver.sh "$build/node" "$work/data" AKIDTEST secretTEST rec \
  < "$work/s3rver.in" > "$work/s3rver.port" &
pids+=($!)
exec 7> "$work/s3rver.in"
for _ in $(seq 600); do [ -s "$work/s3rver.port" ] && break; sleep 0.5; done
s3port=$(head -1 "$work/s3rver.port")

# Counts every PUT on its way to s3rver; writes the count at its standard input's end.
COUNT="$work/puts" TARGET=$s3port node -e '
const http = require("http");
let puts = 0;
const server = http.createServer((req, res) => {
  if (req.method === "PUT") puts++;
  const up = http.request({host: "127.0.0.1", port: +process.env.TARGET, method: req.method,
                           path: req.url, headers: req.headers}, (answer) => {
    res.writeHead(answer.statusCode, answer.headers);
    answer.pipe(res);
  });
  up.on("error", () => res.destroy());
  req.pipe(up);
});
server.listen(0, "127.0.0.1", () => console.log(server.address().port));
process.stdin.on("end", () => { require("fs").writeFileSync(process.env.COUNT, String(puts));
                                process.exit(0); });
process.stdin.resume();
' < "$work/proxy.in" > "$work/proxy.port" &
proxy=$!
pids+=($proxy)
exec 8> "$work/proxy.in"
for _ in $(seq 100); do [ -s "$work/proxy.port" ] && break; sleep 0.1; done
port=$(head -1 "$work/proxy.port")

start=$(date +%s.%N)
AWS_ACCESS_KEY_ID=AKIDTEST AWS_SECRET_ACCESS_KEY=wrong-secret AWS_SESSION_TOKEN=token \
  "$recorder" -input "$clip" -duration "$seconds" -draintimeout 1 -bucketname rec \
  -uploadinterval 1 -authretrytime 3000 -bufferfullsize 10 -kct h264 \
  -endpoint "http://127.0.0.1:$port" -status "$work/status.jsonl" -logfile "$work/log.txt" \
  || echo "recorder exit status $?"
end=$(date +%s.%N)
exec 8>&-
wait "$proxy" || true
printf '| run | PUTs | token requests | credential answers | log bytes |\n|---|---|---|---|---|\n'
printf '| %.0f s | %s | %s | %s | %s |\n' "$(echo "$end - $start" | bc)" "$(cat "$work/puts")" \
  "$(grep -c GetAWSSecureTokenRequest "$work/status.jsonl" || true)" \
  "$(grep -c 'setProperties enter' "$work/log.txt" || true)" "$(wc -c < "$work/log.txt")"
