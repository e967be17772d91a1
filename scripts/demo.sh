#!/usr/bin/env bash
# A guided tour of the file-indexing service on this machine: installs the build
# dependencies, builds the library, the host platform, fileindexctl and the two daemons
# (Release, in build-demo), creates a sandbox system root in a temporary directory with a
# few hundred files, and drives the whole loop through fileindexctl: folders added and
# crawled, files found, created, renamed, photos, music and documents found by what is inside
# them, a file type switched off, indexing paused and resumed, a folder removed.
#
#   bash scripts/demo.sh            (KEEP_SANDBOX=1 keeps the sandbox afterwards)
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/install-deps.sh
BUILD_DIR=${BUILD_DIR:-build-demo}
cmake -S . -B "$BUILD_DIR" -DCMAKE_BUILD_TYPE=Release -DFILEINDEX_TESTS=OFF >/dev/null
cmake --build "$BUILD_DIR" -j"$(nproc)" --target fileindexctl fileindexd fileindex-extract tavotifyd fileindex-probe \
  fileindex-samples >/dev/null
CTL="$PWD/$BUILD_DIR/tools/fileindexctl/fileindexctl"
SAMPLES="$PWD/$BUILD_DIR/tools/samples/fileindex-samples"

SANDBOX=$(mktemp -d /tmp/fileindex-demo.XXXXXX)
cleanup() {
  "$CTL" --sysroot "$SANDBOX" sandbox stop >/dev/null 2>&1 || true
  if [ -n "${KEEP_SANDBOX:-}" ]; then echo "sandbox kept in $SANDBOX"; else rm -rf "$SANDBOX"; fi
}
trap cleanup EXIT

if [ -t 1 ]; then BOLD=$'\e[1m' DIM=$'\e[2m' OFF=$'\e[0m'; else BOLD='' DIM='' OFF=''; fi
step() { printf '\n%s== %s%s\n' "$BOLD" "$*" "$OFF"; }
say() { printf '%s# %s%s\n' "$DIM" "$*" "$OFF"; }
# One fileindexctl command, shown as typed; a failure is shown, not fatal.
ctl() {
  printf '%s$ fileindexctl %s%s\n' "$BOLD" "$*" "$OFF"
  local status=0
  "$CTL" --sysroot "$SANDBOX" --no-syslog "$@" 2>&1 || status=$?
  if [ "$status" -ne 0 ]; then printf '(exit status %d)\n' "$status"; fi
}
now_ms() { date +%s%3N; }
# Waits (at most 20 s) until the service reports the expected overall status.
wait_status() {
  local want=$1 start status
  start=$(now_ms)
  for _ in $(seq 400); do
    status=$("$CTL" --sysroot "$SANDBOX" --no-syslog --json status |
             python3 -c 'import json, sys; print(json.load(sys.stdin).get("status", ""))' 2>/dev/null || true)
    [ "$status" = "$want" ] && { say "status \"$want\" after $(($(now_ms) - start)) ms"; return 0; }
    sleep 0.05
  done
  say "status still \"$status\" after 20 s"
}
# Waits (at most 5 s) until a search for the words finds (or no longer finds) the path.
wait_search() {
  local mode=$1 path=$2 start
  shift 2
  start=$(now_ms)
  for _ in $(seq 250); do
    if "$CTL" --sysroot "$SANDBOX" --no-syslog search "$@" 2>/dev/null | grep -qF "$path"; then
      [ "$mode" = found ] && { say "$path found $(($(now_ms) - start)) ms after the change"; return 0; }
    else
      [ "$mode" = gone ] && { say "$path gone $(($(now_ms) - start)) ms after the change"; return 0; }
    fi
    sleep 0.02
  done
  say "$path still not $mode after 5 s"
}
log_tail() {
  say "fileindexd's log (last lines):"
  tail -n "${1:-4}" "$SANDBOX/var/log/fileindexd.log" | sed 's/^/  /'
}

step "A sandbox: two volumes, five shares, a share table, smb.conf and service hooks"
ctl sandbox init "$SANDBOX"
say "and a few hundred files to find:"
words=(beach mountain city harbour forest sunset river garden bridge market)
for year in 2019 2020; do
  for i in $(seq 0 79); do
    w=${words[$((i % 10))]}
    : > "$SANDBOX/volume1/photo/$year/${w}_$year-$i.jpg"
  done
  mkdir -p "$SANDBOX/volume1/photo/$year/notes"
  for i in $(seq 0 19); do echo "note $i" > "$SANDBOX/volume1/photo/$year/notes/${words[$((i % 10))]} notes $i.txt"; done
done
for i in $(seq 0 59); do : > "$SANDBOX/volume1/video/movies/${words[$((i % 10))]} trip $i.mkv"; done
mkdir -p "$SANDBOX/volume2/music/albums/Café del Mar"
for i in $(seq 0 39); do : > "$SANDBOX/volume2/music/albums/Café del Mar/track $i ${words[$((i % 10))]}.flac"; done
say "$(find "$SANDBOX"/volume* -type f | wc -l) files in the shares"

step "Add folders: the library starts fileindexd (and the notification daemon), which crawls them"
ctl folders add /photo/2019 /photo/2020 --photo --document
ctl folders add /video/movies --video --name Movies
ctl folders add /music/albums --audio
wait_status finished
ctl status

step "Search: every word must begin a word of the name; case and accents do not matter"
ctl search beach 2019 --limit 5
ctl search CAFE
ctl search track BEACH --limit 3
ctl search --kind video sunset --limit 3
ctl search notes --share photo --limit 3

step "macOS Finder searches the shares through Samba: Spotlight answered by fileindexd"
ctl share spotlight
if [ "$(id -u)" != 0 ] || ! command -v smbd >/dev/null || ! command -v mdsearch >/dev/null; then
  say "(skipped: needs root and Debian's samba and smbclient packages)"
elif (exec 3<>/dev/tcp/127.0.0.1/445) 2>/dev/null; then
  say "(skipped: an SMB server already listens on port 445)"
else
  # Samba's user must reach the share; smbd and the helpers it starts live in a process
  # namespace of their own and end with it.
  chmod a+rX "$SANDBOX" "$SANDBOX/volume1" && chmod -R a+rX "$SANDBOX/volume1/photo"
  unshare --pid --fork --mount-proc bash -c '
    source scripts/samba-spotlight.sh
    trap samba_cleanup EXIT
    samba_start "$1/samba" "$1" photo "$1/volume1/photo" || exit 1
    echo "\$ mdsearch 127.0.0.1 photo '"'"'kMDItemFSName==\"sunset*\" && kMDItemContentType==\"public.jpeg\"'"'"'"
    samba_search photo "kMDItemFSName==\"sunset*\" && kMDItemContentType==\"public.jpeg\"" | head -4 | sed "s/^/  /"
  ' _ "$SANDBOX" || say "(Samba could not be started; see $SANDBOX/samba/log)"
fi

step "What is inside the files: photos by camera and date taken, songs by their tags, documents by their words"
"$SAMPLES" "$SANDBOX"
say "photos with EXIF, tagged MP3 and FLAC songs, a video, a PDF, a .docx and an .odt, and a photo cut short"
say "fileindexd hands them to fileindex-extract (nice 19, idle I/O, a time and a memory limit per file)"
wait_search found /photo/2020/trip/IMG_0412.jpg --camera kestrel
ctl search --camera kestrel
ctl search --kind photo --taken-after 2020-08-01
wait_search found "/music/albums/Low Tide/03.flac" --artist gulls
ctl search --artist gulls --album tide
ctl search --title lighthouse
wait_search found /photo/2020/trip/itinerary.pdf --text puffin
ctl search --text puffin
ctl search --text guillemots
ctl search --text binoculars --json
ctl why /photo/2020/trip/IMG_0977.jpg
ctl why /photo/2020/trip/IMG_0413.jpg

step "A new file is found within moments"
: > "$SANDBOX/volume1/photo/2020/lighthouse.jpg"
wait_search found /photo/2020/lighthouse.jpg lighthouse
ctl search lighthouse

step "Rename it: the old name is gone, the new one found"
mv "$SANDBOX/volume1/photo/2020/lighthouse.jpg" "$SANDBOX/volume1/photo/2020/old-lighthouse.jpg"
wait_search found /photo/2020/old-lighthouse.jpg old lighthouse
ctl search lighthouse
log_tail 3

step "Switch the photo flag of /photo/2019 off: its photos leave the index (its notes stay)"
ctl folders set /photo/2019 --no-photo
wait_search gone /photo/2019/beach_2019-0.jpg beach 2019
ctl search 2019 --limit 4
ctl why /photo/2019/beach_2019-0.jpg
wait_status finished
ctl status /photo/2019

step "Pause: status \"paused\", and a new file waits"
ctl pause 1
: > "$SANDBOX/volume1/photo/2020/paused-picture.jpg"
sleep 1
ctl status /photo/2020
ctl search paused picture
step "Resume: the waiting work is done"
ctl resume
wait_search found /photo/2020/paused-picture.jpg paused picture
ctl search paused picture

step "Remove a folder: its files are gone from search"
ctl folders remove /video/movies
wait_search gone "/video/movies/sunset trip 6.mkv" sunset trip
ctl search trip --limit 3
wait_status finished
ctl status

step "The rules still decide what may be indexed"
ctl path can-index '/photo/#recycle'
ctl path can-index /photo/latest
ctl share can-index vault

step "Failures say in one line what failed and why; -v adds the library's log lines"
ctl folders get /photo/nowhere
ctl -v folders get /photo/nowhere
ctl folders add /nowhere/x

printf '\n%sDone.%s The daemons are stopped and the sandbox removed on exit.\n' "$BOLD" "$OFF"
