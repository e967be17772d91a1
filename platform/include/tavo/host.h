/* The host platform: the appliance interfaces of platform.h on a plain Linux machine.
 *
 * Every file below lives under FILEINDEX_SYSROOT when it is set (it is prefixed as is):
 *
 *   /etc/tavo/shares.json          the share table, re-read whenever the file changes:
 *                                  {"shares": [{"name": "photo", "path": "/volume1/photo",
 *                                   "readonly": false, "encrypted": false, "encryption": false,
 *                                   "recycle_bin": true, "free_bytes": 1048576}]}
 *                                  "path" is the share directory (rooted too) and must end
 *                                  with a component equal to the name; "free_bytes", when
 *                                  present, is the share's quota of free space in bytes.
 *   /run/tavo/service/<name>       a service's state, "running" or "stopped".
 *   /etc/tavo/services/<name>      optional executable hook of a service, run with "status"
 *                                  (exit 0 when running), "start", "stop" or "restart"; a
 *                                  non-zero exit fails the call.
 *   /etc/samba/smb.conf            Spotlight is the "spotlight" parameter of [global], with
 *                                  the Elasticsearch backend that fileindexd answers.
 *   /run/tavotifyd/<queue name>/<queue path>.json
 *                                  the notification daemon's watch list of one queue.
 *
 * Programs run by VLIBCExec and VLIBCExecv: an absolute program path that names an
 * executable file under the system root is run from there, any other from the host. So a
 * sandbox may provide /usr/tavo/bin/tavovemnotify while /bin/rm stays the host's. */
#ifndef TAVO_HOST_H
#define TAVO_HOST_H

#ifdef __cplusplus
extern "C" {
#endif

/* A short English text for a platform error code of VLIBCErrGet(); never null. */
const char* TAVOHostErrorText(int code);

#ifdef __cplusplus
}
#endif

#endif
