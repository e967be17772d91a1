#!/usr/bin/env bash
# Installs the Debian packages the project builds and tests with (as root), skipping
# what is already installed.
set -euo pipefail
packages=(cmake make g++ pkg-config libjsoncpp-dev libicu-dev libgtest-dev libgmock-dev
          libbenchmark-dev libcli11-dev python3 abigail-tools
          clang-14 libclang-rt-14-dev
          libsqlite3-dev sqlite3 libsystemd-dev util-linux procps
          libcpp-httplib-dev samba smbclient iproute2 passwd
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
  # Samba's packages start smbd where no service manager says otherwise; the tests run
  # their own smbd in a private namespace and want no system one. A policy of our own,
  # only while installing and only where the machine has none, keeps services down.
  policy=/usr/sbin/policy-rc.d
  own_policy=0
  if [ ! -e "$policy" ]; then
    printf '#!/bin/sh\nexit 101\n' | $SUDO tee "$policy" >/dev/null
    $SUDO chmod 755 "$policy"
    own_policy=1
  fi
  status=0
  DEBIAN_FRONTEND=noninteractive $SUDO apt-get install -y "${missing[@]}" || status=$?
  [ $own_policy = 0 ] || $SUDO rm -f "$policy"
  [ $status = 0 ] || exit $status
fi
