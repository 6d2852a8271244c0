/* The receiving server's pairing store: which sending clients are paired with this server, which
 * client is bound to each shared folder, and the heartbeat of each running task.
 *
 * Everything lives in one section file, "/usr/vurn/etc/vurnS2S.info" (below $S2S_ROOT when that
 * is set). Writers serialise through a system-wide semaphore and rewrite one section per call;
 * readers take no lock. Failures go to syslog at LOG_ERR.
 *
 * Plain C functions with unmangled names: the server's command handlers and status pages call
 * them from C as well as C++. Tables are the platform's string hashes, share lists its string
 * lists, returned strings platform strings released with VLIBCStrPut. */
#ifndef S2S_SERVER_H
#define S2S_SERVER_H

#include "s2s_export.h"
#include "s2s_platform.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Result codes of the pairing functions (positive, distinct from the library's status codes). */
#define S2S_SVR_OK 0
#define S2S_SVR_ERR_ALLOC 200        /* a key/value table could not be allocated */
#define S2S_SVR_ERR_ARGUMENT 201     /* a required argument is null or empty */
#define S2S_SVR_ERR_KEY 202          /* a key is missing from a table, or could not be set */
#define S2S_SVR_ERR_WRITE 205        /* writing a section failed */
#define S2S_SVR_ERR_READ 206         /* reading a section failed */
#define S2S_SVR_ERR_SHARE_PAIRED 214 /* some shares are bound to another client */

/* The server's state as a status page shows it. Filled by s2s_svr_get_status; the strings belong
 * to the record until s2s_svr_put_status releases them. */
typedef struct s2s_svr_status {
    int running;       /* 1: the service is switched on and the rsync daemon is alive */
    int busy;          /* 1: some task sent a heartbeat less than 120 seconds ago */
    char* client_id;   /* "PairedClientInfo"/"clientID", or null */
    char* server_name; /* "PairedClientInfo"/"serverName", or null */
} s2s_svr_status;

/* 1 when `path` names an existing regular file (symbolic links followed); 0 for null, a missing
 * path or any other kind of file. */
S2S_EXPORT int isFileExist(const char* path);

/* Creates the store (empty) when it does not exist yet. Always 0. */
S2S_EXPORT int S2SCheckServerInfo(void);

/* Reads the pairs of `section` into `*out` (an allocated table, which may be reallocated).
 * Negative on error, 0 when the section is absent, positive when it was found. */
S2S_EXPORT int S2SGetServerInfo(const char* section, VLIBSzHash** out);

/* Copies the value of `key` in the section "SHARE_<share>" into `buf` (`size` bytes with the
 * terminating zero). -1 for a null or zero argument; else the platform's result for the value
 * read (negative when the section or key is absent, with the platform error 0x2200). */
S2S_EXPORT int S2SServerGetShare(const char* share, const char* key, char* buf, int size);

/* Sets the pairs of `values` in `section`, keeping the section's other keys; the section is
 * appended when it does not exist yet. One locked read-modify-write. 0, or -1 on any failure,
 * with the platform error set; VLIB_ERR_TOO_LARGE when the store would grow past the size its
 * reader accepts (VLIB_SECTION_FILE_MAX): such a write is refused before anything is written. */
S2S_EXPORT int S2SUpdateServerInfo(const char* section, VLIBSzHash* values);

/* S2SUpdateServerInfo on "TASK_<task>" (a task's "status": "idle" or its heartbeat time). */
S2S_EXPORT int S2SServerUpdateTask(const char* task, VLIBSzHash* values);

/* S2SUpdateServerInfo on "SHARE_<share>" (the share's "CompleteID" and "RunningID"). */
S2S_EXPORT int S2SServerUpdateShare(const char* share, VLIBSzHash* values);

/* Sets "clientID" and "serverName" of "PairedClientInfo" from `values`, keeping the section's
 * other keys. 0, or 201 (null), 200, 202 (a key missing), 205 (write) or 206 (read). */
S2S_EXPORT int S2SServerSetPairValue(VLIBSzHash* values);

/* Records a client in the multi-client scheme: "CLIENTID_<client_id>" gets "ServerName", and
 * "PairedClientInfo" is marked multi-client. 0, or 201, 200, 202 or 205. */
S2S_EXPORT int S2SServerUpdatePairInfo(const char* client_id, const char* server_name);

/* 1 while a client paired in the older single-client scheme is still recorded, 0 when not (or
 * the store is multi-client), -1 when the pairing section cannot be read. */
S2S_EXPORT int S2SServerIfOldClientPaired(void);

/* Converts the store to the multi-client scheme: the single client moves to its own
 * "CLIENTID_" section and "PairedClientInfo" gets the multi-client marker. 0 or -1. Not
 * idempotent: callers ask S2SServerIfOldClientPaired first. */
S2S_EXPORT int s2s_svr_reset_pair(void);

/* Decides which of `shares` the client `client_id` may not pair with: those bound to another
 * client are pushed to `*refused` (emptied first). 0 when none is refused, 214 when some are,
 * 201 for missing arguments, 206 when a share's section cannot be read. */
S2S_EXPORT int S2SCheckIfSharePaired(VLIBSzList* shares, const char* client_id,
                                     VLIBSzList** refused);

/* Fills `status`. 0, or -1 when the pairing section cannot be read (then only `running` is
 * set). Release the strings with s2s_svr_put_status. */
S2S_EXPORT int s2s_svr_get_status(s2s_svr_status* status);

/* Releases the strings of `status` (not the record itself); null does nothing. Always 0. */
S2S_EXPORT int s2s_svr_put_status(s2s_svr_status* status);

#ifdef __cplusplus
}
#endif

#endif /* S2S_SERVER_H */
