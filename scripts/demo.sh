#!/usr/bin/env bash
# A guided tour of fileindexctl on this machine: installs the build dependencies, builds
# the library, the host platform, the CLI and the daemon probe (Release, in build-demo),
# creates a sandbox system root in a temporary directory and drives the library through
# it, showing after each step what reached the daemon (the probe's log), the per-share
# event queues and the notification daemon's watch lists.
#
#   bash scripts/demo.sh            (KEEP_SANDBOX=1 keeps the sandbox afterwards)
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/install-deps.sh
BUILD_DIR=${BUILD_DIR:-build-demo}
cmake -S . -B "$BUILD_DIR" -DCMAKE_BUILD_TYPE=Release -DFILEINDEX_TESTS=OFF >/dev/null
cmake --build "$BUILD_DIR" -j"$(nproc)" --target fileindexctl fileindex-probe >/dev/null
CTL="$PWD/$BUILD_DIR/tools/fileindexctl/fileindexctl"

SANDBOX=$(mktemp -d /tmp/fileindex-demo.XXXXXX)
cleanup() {
  "$CTL" --sysroot "$SANDBOX" sandbox stop >/dev/null 2>&1 || true
  if [ -n "${KEEP_SANDBOX:-}" ]; then echo "sandbox kept in $SANDBOX"; else rm -rf "$SANDBOX"; fi
}
trap cleanup EXIT

if [ -t 1 ]; then BOLD=$'\e[1m' DIM=$'\e[2m' OFF=$'\e[0m'; else BOLD='' DIM='' OFF=''; fi
DAEMON_LOG="$SANDBOX/var/log/fileindexd.log"
seen=0

step() { printf '\n%s== %s%s\n' "$BOLD" "$*" "$OFF"; }
say() { printf '%s# %s%s\n' "$DIM" "$*" "$OFF"; }
# One fileindexctl command, shown as typed; a failure is shown, not fatal.
ctl() {
  printf '%s$ fileindexctl %s%s\n' "$BOLD" "$*" "$OFF"
  local status=0
  "$CTL" --sysroot "$SANDBOX" --no-syslog "$@" 2>&1 || status=$?
  if [ "$status" -ne 0 ]; then printf '(exit status %d)\n' "$status"; fi
}
# The commands the daemon received since the last look.
daemon() {
  sleep 0.1  # the probe writes its line once it has read the whole frame
  local total=0
  [ -f "$DAEMON_LOG" ] && total=$(wc -l < "$DAEMON_LOG")
  if [ "$total" -gt "$seen" ]; then
    echo "daemon received:"
    tail -n +"$((seen + 1))" "$DAEMON_LOG" | sed 's/^/  /'
  else
    echo "daemon received: nothing"
  fi
  seen=$total
}
queues() {
  local found=0 file
  while IFS= read -r file; do
    found=1
    echo "queue ${file#"$SANDBOX"}:"
    sed 's/^/  /' "$file"
  done < <(find "$SANDBOX"/volume* -path '*/@eaDir/TAVO@file_index_queue*' -type f 2>/dev/null | sort)
  [ "$found" -eq 1 ] || echo "queues: none"
}
watches() {
  local found=0 file
  while IFS= read -r file; do
    found=1
    echo "watch list ${file#"$SANDBOX"}:"
    sed 's/^/  /' "$file"
  done < <(find "$SANDBOX/run/tavotifyd" -name '*.json' -type f 2>/dev/null | sort)
  [ "$found" -eq 1 ] || echo "watch lists: none"
}
services() {
  echo "fileindexd: $(cat "$SANDBOX/run/tavo/service/fileindexd" 2>/dev/null || echo never started)," \
       "Samba spotlight: $(sed -n 's/^[[:space:]]*spotlight = //p' "$SANDBOX/etc/samba/smb.conf" | head -1)"
  [ -f "$SANDBOX/var/log/services.log" ] && sed 's/^/  services.log: /' "$SANDBOX/var/log/services.log"
  : > "$SANDBOX/var/log/services.log"
}

step "A sandbox: two volumes, five shares, a share table, smb.conf and service hooks"
ctl sandbox init "$SANDBOX"
say "share directories and a few files (photo/latest is a symbolic link to 2020):"
(cd "$SANDBOX" && find volume1/photo volume1/video -mindepth 1 | sort | sed 's/^/  /')

step "Add folders in two shares"
ctl folders add /photo/2019 /photo/2020
ctl folders add /video/movies --video --name Movies
say "the first add started fileindexd (the probe) and switched Samba's Spotlight on:"
services
daemon
queues
watches

step "List them with their status"
ctl folders list --additional status,is_valid
ctl folders list --sort-by name --direction DESC --limit 2
ctl status

step "Check a few paths"
ctl path indexed /photo/2019/beach.jpg
ctl path can-index /photo/2019
say "the recycle bin at the top of a share is never indexed:"
ctl path can-index '/photo/#recycle'
ctl path skip "$SANDBOX/volume1/photo/#recycle/deleted.jpg"
say "nor is a path through a symbolic link, nor a read-only or encrypted share:"
ctl path can-index /photo/latest
ctl path indexed /photo/latest/city.jpg
ctl path can-index /docs/manuals
ctl share can-index vault
ctl path queue photo

step "Pause for 2 hours, then resume"
ctl pause 2
ctl status
daemon
ctl resume
daemon

step "Reindex a folder (a second request is absorbed by the pending one)"
ctl reindex /photo/2019
ctl reindex /photo/2019
queues

step "A share runs out of space: the administrators are notified once"
ctl share flags photo --no-space set
sed 's/^/  notify.log: /' "$SANDBOX/var/log/notify.log"
ctl status /photo/2019
ctl share revive photo
daemon

step "Rename a share: pause it, rename it on the appliance, move its folders, resume it"
ctl share pause video
daemon
watches
ctl sandbox rename-share video films
ctl share rename video films
ctl share resume films
daemon
watches
ctl folders list

step "Remove folders until the daemon is stopped"
ctl folders remove /photo/2020
daemon
queues
ctl folders remove /photo/2019
say "photo has no folder left: its queue and watch list are gone"
daemon
queues
watches
ctl folders remove /films/movies
say "no folder left at all: fileindexd stopped, Spotlight off, Samba restarted"
services
daemon
queues
watches
ctl status

step "Failures say in one line what failed and why; -v adds the library's log lines"
ctl folders get /photo/2019
ctl -v folders get /photo/2019
ctl folders add /nowhere/x

printf '\n%sDone.%s The probe is stopped and the sandbox removed on exit.\n' "$BOLD" "$OFF"
