#!/usr/bin/env bash
# Installs the Debian packages that building and testing orvane needs, only when some are missing.
set -euo pipefail

packages=(
    build-essential cmake pkg-config
    libgtest-dev libgmock-dev libbenchmark-dev
    libsqlite3-dev sqlite3 libxml2-dev libjsoncpp-dev libminizip-dev zlib1g-dev
    android-libutils-dev android-liblog-dev android-libcutils-dev android-libbase-dev
    android-platform-frameworks-native-headers
    # libcrypto: OpenSSL for the host build, BoringSSL's headers for the device syntax check
    libssl-dev android-libboringssl-dev
    zip unzip libfuse3-dev fuse3 clang libclang-rt-14-dev python3
)

missing=()
for p in "${packages[@]}"; do
    dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
[ ${#missing[@]} -eq 0 ] && exit 0

sudo=""
[ "$(id -u)" -ne 0 ] && sudo="sudo"
echo "installing: ${missing[*]}"
$sudo apt-get update -qq
DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq --no-install-recommends "${missing[@]}"
