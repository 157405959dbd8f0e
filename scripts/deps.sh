#!/usr/bin/env bash
# Installs what the build and the tests need from Debian's packages, when it is
# missing. Safe to run again.
set -euo pipefail

packages=(g++ cmake make pkg-config zlib1g-dev libicu-dev libasio-dev libgtest-dev libgmock-dev
          libbenchmark-dev libssl-dev openssl libsystemd-dev openjdk-17-jdk-headless clang libclang-rt-14-dev iproute2 nftables
          tcpdump systemd man-db groff-base lintian dpkg-dev fakeroot file)
missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if [ ${#missing[@]} -gt 0 ]; then
  echo "installing: ${missing[*]}"
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
fi
