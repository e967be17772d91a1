#!/usr/bin/env bash
# Finder's searches through a real Samba: a sandbox whose indexing daemon answers Spotlight,
# smbd serving one of its shares, and mdsearch (Samba's Spotlight client) asking what Finder
# asks, all in private network and process namespaces so that ports and daemons are the test's.
#
#   samba_mdsearch.sh BUILD_DIR     (as root; exit 77 when it cannot run here)
set -euo pipefail
build=$(cd "${1:?usage: $0 BUILD_DIR}" && pwd)
ctl="$build/tools/fileindexctl/fileindexctl"
self=$(readlink -f "$0")

if [ "${2:-}" != --inside ]; then
  [ "$(id -u)" = 0 ] || { echo "skipped: smbd and the namespaces need root"; exit 77; }
  for tool in smbd mdsearch smbpasswd unshare ip setpriv; do
    command -v "$tool" >/dev/null || { echo "missing $tool: install samba, smbclient, iproute2 (scripts/install-deps.sh)" >&2; exit 1; }
  done
  unshare --net --pid --fork --mount-proc true 2>/dev/null ||
    { echo "skipped: this machine does not allow private network and process namespaces"; exit 77; }
  exec timeout --kill-after=5 240 unshare --net --pid --fork --mount-proc "$self" "$build" --inside
fi

ip link set lo up
work=$(mktemp -d /tmp/fileindex-samba.XXXXXX)
chmod 755 "$work"
source "$(dirname "$self")/../../scripts/samba-spotlight.sh"
cleanup() {
  status=$?
  [ $status = 0 ] || for log in root/var/log/fileindexd.log samba/log/log.rpcd_mdssvc; do
    echo "--- $log"; tail -n 30 "$work/$log" 2>/dev/null || true
  done
  samba_cleanup
  rm -rf "$work"
  exit $status
}
trap cleanup EXIT
fail() { echo "FAIL: $*" >&2; exit 1; }

# The sandbox, with its daemon's Spotlight endpoint on Samba's default port.
"$ctl" sandbox init "$work/root" --spotlight-port 9200 >/dev/null
root=$(readlink -f "$work/root")
share="$root/volume1/photo"
mkfile() {  # path size date
  mkdir -p "$(dirname "$share/$1")"
  head -c "$2" /dev/zero >"$share/$1"
  touch -d "$3 12:00 UTC" "$share/$1"
}
mkfile "2020/beach one.jpg" 20 2021-06-01
mkfile "2020/Beach (1) copy.jpg" 5 2019-05-01
mkfile "2020/beach notes.txt" 100 2022-01-01
mkfile "2020/Café del Mar.flac" 15 2020-07-01
mkfile "2020/sunset.png" 30 2020-08-01
mkfile "2020/trips/beach walk.mp4" 12 2020-09-01
mkfile "elsewhere/beach outside.jpg" 20 2021-06-01  # in no indexed folder
touch -d "2020-01-01 12:00 UTC" "$share/2020/city.jpg" "$share/2020/trips" "$share/2020"
chmod -R a+rX "$root"
fctl() { "$ctl" --sysroot "$root" --no-syslog "$@"; }
fctl folders add /photo/2020 --photo --document --audio --video >/dev/null
grep -q "spotlight backend = elasticsearch" "$root/etc/samba/smb.conf" ||
  fail "the library did not switch Spotlight on in smb.conf"

samba_start "$work/samba" "$root" photo "$share"
# mdsearch's own failures (a session Samba could not set up on a loaded machine) are retried once.
search() {
  local out
  out=$(samba_search photo "$1") && { printf '%s\n' "$out"; return; }
  echo "mdsearch failed once: $out" >&2
  sleep 1
  samba_search photo "$1"
}
expect() {  # query, expected paths
  local got
  got=$(search "$1") || fail "$1: mdsearch failed: $got"
  [ "$got" = "$(printf '%s\n' "${@:2}" | sed '/^$/d' | sort)" ] || fail "$1: expected [${*:2}], got [$got]"
  echo "ok: $1 -> $(echo "$got" | paste -sd '|')"
}

# The first crawl is done when the deepest file can be found.
for _ in $(seq 100); do
  [ "$(search 'kMDItemFSName=="beach walk*"')" = "2020/trips/beach walk.mp4" ] && break
  sleep 0.1
done

# Samba hands names to macOS decomposed (NFD), as Finder uses them.
cafe=$'2020/Cafe\xcc\x81 del Mar.flac'
expect 'kMDItemFSName=="beach*"' "2020/beach one.jpg" "2020/Beach (1) copy.jpg" "2020/beach notes.txt" \
  "2020/trips/beach walk.mp4"
expect '*=="walk*"' "2020/trips/beach walk.mp4"
expect 'kMDItemContentType=="public.jpeg"' "2020/beach one.jpg" "2020/Beach (1) copy.jpg" "2020/city.jpg"
expect '_kMDItemGroupId=="13"' "2020/beach one.jpg" "2020/Beach (1) copy.jpg" "2020/sunset.png" "2020/city.jpg"
expect 'kMDItemFSSize>"14" && kMDItemFSSize<"31"' "2020/beach one.jpg" "$cafe" "2020/sunset.png"
expect 'kMDItemFSContentChangeDate>$time.iso(2021-01-01T00:00:00Z)' "2020/beach one.jpg" "2020/beach notes.txt"
expect 'kMDItemFSName=="beach*" && kMDItemFSName!="*.jpg"' "2020/beach notes.txt" "2020/trips/beach walk.mp4"
expect 'kMDItemFSName=="sunset*" || kMDItemFSName=="café*"' "2020/sunset.png" "$cafe"
expect 'kMDItemFSName=="beach (1)*"' "2020/Beach (1) copy.jpg"
expect 'kMDItemDisplayName=="CAFÉ DEL*"' "$cafe"
expect 'kMDItemFSName=="outside*"' ""

# A new file is found within two seconds, and searches are answered while indexing is paused.
mkfile "2020/lighthouse.jpg" 10 2021-01-01
start=$(date +%s%N)
until [ "$(search 'kMDItemFSName=="lighthouse*"')" = "2020/lighthouse.jpg" ]; do
  [ $(( ($(date +%s%N) - start) / 1000000 )) -lt 2000 ] || fail "a new file was not found within 2 s"
  sleep 0.05
done
fctl pause 1 >/dev/null
expect 'kMDItemFSName=="lighthouse*"' "2020/lighthouse.jpg"
fctl resume >/dev/null

# Only Samba (root) may ask: another local user is refused, whatever it asks.
request='{"from":0,"size":50,"query":{"query_string":{"query":"(beach*) AND path.real.fulltext:\"'$share'\""}}}'
ask() {  # user
  setpriv --reuid="$1" --regid="$1" --clear-groups bash -c '
    exec 3<>/dev/tcp/127.0.0.1/9200
    printf "POST /_all/_search HTTP/1.1\r\nHost: localhost\r\nContent-Type: application/json\r\nContent-Length: %d\r\nConnection: close\r\n\r\n%s" "${#1}" "$1" >&3
    head -n 1 <&3' _ "$request" | tr -d '\r'
}
[ "$(ask 0)" = "HTTP/1.1 200 OK" ] || fail "root was not answered: $(ask 0)"
[ "$(ask 65534)" = "HTTP/1.1 403 Forbidden" ] || fail "another user was answered: $(ask 65534)"
echo "ok: root answered, another user refused"

# The daemon ends cleanly, and under the sanitizers without a report.
fctl sandbox stop >/dev/null
! grep -E "runtime error|AddressSanitizer|LeakSanitizer" "$root/var/log/fileindexd.log" ||
  fail "a sanitizer report in fileindexd's log"
