#!/usr/bin/env bash
# Starts an S3 test server (@20minutes/s3rver) on 127.0.0.1 at a free port and prints that port
# as the first line of its standard output.
#
# Usage: scripts/s3rver.sh NODE_PREFIX DATA_DIR ACCESS_KEY SECRET_KEY BUCKET...
#   NODE_PREFIX  npm prefix inside the build tree; s3rver is installed there when missing
#                (never globally). Callers running at the same time share it safely: the
#                install is serialised by a lock file and marked done only when complete.
#   DATA_DIR     where the server keeps its buckets; give each server its own.
#   ACCESS_KEY, SECRET_KEY  a key pair the server accepts (besides its built-in S3RVER/S3RVER).
#   BUCKET...    buckets that exist from the start.
#
# The server runs until SIGTERM/SIGKILL or until its standard input reaches end of file, so a
# caller that hands it a pipe cannot leave it behind by dying.
set -euo pipefail
if [ $# -lt 5 ]; then
  echo "usage: $0 NODE_PREFIX DATA_DIR ACCESS_KEY SECRET_KEY BUCKET..." >&2
  exit 2
fi
prefix=$1 data=$2 key=$3 secret=$4
shift 4
version=4.0.4
mkdir -p "$prefix" "$data"
marker="$prefix/.s3rver-$version.installed"
if [ ! -f "$marker" ]; then
  (
    flock -w 900 9
    if [ ! -f "$marker" ]; then
      npm install --prefix "$prefix" --no-audit --no-fund --loglevel=error \
        "@20minutes/s3rver@$version" >&2
      touch "$marker"
    fi
  ) 9>"$prefix/.s3rver-install.lock"
fi

export NODE_PATH="$prefix/node_modules"
export S3RVER_DATA="$data" S3RVER_KEY="$key" S3RVER_SECRET="$secret" S3RVER_BUCKETS="$*"
exec node -e '
const S3rver = require("@20minutes/s3rver");
const account = require("@20minutes/s3rver/lib/models/account");
account.DUMMY_ACCOUNT.createKeyPair(process.env.S3RVER_KEY, process.env.S3RVER_SECRET);
const buckets = process.env.S3RVER_BUCKETS.split(" ").filter(Boolean)
  .map((name) => ({ name, configs: [] }));
new S3rver({ address: "127.0.0.1", port: 0, directory: process.env.S3RVER_DATA, silent: true,
             configureBuckets: buckets })
  .run()
  .then((address) => console.log(address.port),
        (error) => { console.error(error); process.exit(1); });
process.stdin.on("end", () => process.exit(0));
process.stdin.on("error", () => process.exit(0));
process.stdin.resume();
'
