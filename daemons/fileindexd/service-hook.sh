#!/bin/sh
# Service hook of fileindexd on a host run by systemd. The host platform runs it with
# status, start, stop or restart when the library starts or stops the indexing service.
case "$1" in
  status) exec systemctl is-active --quiet fileindexd.service ;;
  start | stop | restart) exec systemctl "$1" fileindexd.service ;;
  *)
    echo "usage: $0 status|start|stop|restart" >&2
    exit 2
    ;;
esac
