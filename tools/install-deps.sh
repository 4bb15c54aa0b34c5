#!/usr/bin/env bash
# Installs what the build and the tests need on a fresh Debian machine; does nothing when all is
# there already.
set -euo pipefail

packages=(
  cmake ninja-build g++ clang libclang-rt-14-dev
  libgtest-dev libgmock-dev googletest libbenchmark-dev
  binutils procps util-linux coreutils git
  openjdk-17-jdk-headless
  dpkg-dev file # dpkg-shlibdeps and the ELF files of the package that tools/package.sh builds
  man-db groff-base # man -l and groff, which the tests of the manual pages format them with
)

missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
[ ${#missing[@]} -eq 0 ] && exit 0

echo "installing: ${missing[*]}"
sudo=""
[ "$(id -u)" -eq 0 ] || sudo="sudo"
export DEBIAN_FRONTEND=noninteractive
$sudo apt-get update
$sudo apt-get install -y --no-install-recommends "${missing[@]}"
