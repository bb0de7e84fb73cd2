#!/usr/bin/env bash
# Installs every Debian package the project needs. Idempotent: quiet and quick when all is there.
set -euo pipefail
packages=(
  g++ cmake ninja-build make pkg-config clang-format clang-tidy
  libboost-thread-dev libboost-chrono-dev
  libavformat-dev libavcodec-dev libavutil-dev
  libcurl4-openssl-dev libssl-dev
  libspdlog-dev libfmt-dev nlohmann-json3-dev
  libunwind-dev libdw-dev libiberty-dev
  libgtest-dev libgmock-dev libbenchmark-dev prometheus-cpp-dev
  ffmpeg awscli chromium curl
)
missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
# Node.js comes with the machine (with npm bundled); install it only where node is missing.
command -v node >/dev/null 2>&1 || missing+=(nodejs)
if [ ${#missing[@]} -gt 0 ]; then
  echo "installing: ${missing[*]}"
  SUDO=""; [ "$(id -u)" -ne 0 ] && SUDO=sudo
  $SUDO apt-get update -qq
  DEBIAN_FRONTEND=noninteractive $SUDO apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
fi
