#!/usr/bin/env bash
# Installs the Debian packages the project builds and tests with (as root), skipping
# what is already installed.
set -euo pipefail
packages=(cmake make g++ pkg-config libjsoncpp-dev libicu-dev libgtest-dev libgmock-dev
          libbenchmark-dev libcli11-dev python3 abigail-tools
          clang-14 libclang-rt-14-dev
          libsqlite3-dev sqlite3 libsystemd-dev util-linux procps
          libexiv2-dev libtag1-dev libpoppler-cpp-dev libavformat-dev libavcodec-dev libavutil-dev
          libmagic-dev libzip-dev libexpat1-dev zlib1g-dev)
missing=()
for p in "${packages[@]}"; do
  dpkg -s "$p" >/dev/null 2>&1 || missing+=("$p")
done
if ((${#missing[@]})); then
  SUDO=""
  [ "$(id -u)" -eq 0 ] || SUDO="sudo"
  $SUDO apt-get update
  DEBIAN_FRONTEND=noninteractive $SUDO apt-get install -y "${missing[@]}"
fi
