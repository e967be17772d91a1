# Samba serving one share of a sandbox with Spotlight, for trying Finder's searches with
# mdsearch (Samba's own Spotlight client). Sourced by the Spotlight test and the tour;
# run it as root, in a process namespace of its own (unshare --pid --fork --mount-proc)
# so that smbd and the helpers it starts end with the caller.
#
#   samba_start WORK ROOT SHARE DIR   smbd on 127.0.0.1:445 serving DIR as SHARE, reading
#                                     the sandbox ROOT's smb.conf for Spotlight
#   samba_search SHARE QUERY          mdsearch's answer: share-relative paths, sorted
#   samba_cleanup                     removes the user samba_start added

SAMBA_USER=fidx-mdsearch
SAMBA_PASSWORD=secret
samba_created_user=0

samba_start() {
  local work=$1 root=$2 share=$3 dir=$4
  SAMBA_DIR=$work
  mkdir -p "$work"/{private,lock,state,cache,pid,ncalrpc,log}
  cat >"$work/smb.conf" <<CONF
[global]
	private dir = $work/private
	lock directory = $work/lock
	state directory = $work/state
	cache directory = $work/cache
	pid directory = $work/pid
	ncalrpc dir = $work/ncalrpc
	interfaces = lo
	bind interfaces only = yes
	disable netbios = yes
	smb ports = 445
	include = $root/etc/samba/smb.conf
[$share]
	path = $dir
	read only = yes
	elasticsearch:max results = 50
CONF
  if ! id "$SAMBA_USER" >/dev/null 2>&1; then
    useradd --system --no-create-home --shell /usr/sbin/nologin "$SAMBA_USER"
    samba_created_user=1
  fi
  printf '%s\n%s\n' "$SAMBA_PASSWORD" "$SAMBA_PASSWORD" |
    smbpasswd -c "$work/smb.conf" -a -s "$SAMBA_USER" >/dev/null 2>&1
  smbd -F -s "$work/smb.conf" -l "$work/log" </dev/null &
  local _
  for _ in $(seq 100); do
    (exec 3<>/dev/tcp/127.0.0.1/445) 2>/dev/null && return 0
    sleep 0.1
  done
  echo "smbd did not start (see $work/log)" >&2
  return 1
}

samba_search() {
  timeout 20 mdsearch -s "$SAMBA_DIR/smb.conf" -U "$SAMBA_USER%$SAMBA_PASSWORD" 127.0.0.1 "$1" "$2" 2>&1 | sort
}

samba_cleanup() {
  if [ "$samba_created_user" = 1 ]; then
    userdel "$SAMBA_USER" 2>/dev/null || true
  fi
}
