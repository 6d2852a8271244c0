/* The platform layer: the host services the sync library stands on, for an ordinary Linux server.
 *
 * Section files, string tables and lists, platform strings, the last platform error, System V
 * semaphores, pid-file checks, service control, share records, host facts, volume path parsing and
 * the usable-address query. Plain C (usable from C and C++), every function exported.
 *
 * Conventions
 * - Functions that can fail set the calling thread's last platform error (VLIBCErrGet): 0 on
 *   success, one of the VLIB_ERR_* codes on failure. Failures caused by bad files or system calls
 *   also write one ERROR line to the library's log; an absent section, key or share does not.
 * - Paths given to these functions are used as given. The system's own fixed paths (the
 *   S2S_PATH_* names below) go through S2SPath() first, which moves them under $S2S_ROOT when that
 *   is set.
 * - Strings handed back to the caller are released with the function named next to them; records
 *   and tables are released by whoever obtained them.
 */
#ifndef S2S_PLATFORM_H
#define S2S_PLATFORM_H

#include <stddef.h>

#include "s2s_export.h"

#ifdef __cplusplus
extern "C" {
#endif

/* ---------------------------------------------------------------------------------------------
 * Fixed paths. Every absolute path the system reads or writes on its own account is named here
 * and nowhere else; code passes one of these through S2SPath() to get the path to open.
 * ------------------------------------------------------------------------------------------- */
#define S2S_PATH_PAIRING_STORE "/usr/vurn/etc/vurnS2S.info" /* receiving side's pairing store */
#define S2S_PATH_RSYNCD_PID "/var/run/rsyncd.pid"           /* rsync daemon's pid file */
#define S2S_PATH_TEMP_DIR "/tmp/S2S"                        /* temporary files of remote commands */
#define S2S_PATH_TEMP_TEMPLATE "/tmp/S2S/temp.XXXXXX"       /* mkstemp template inside it */
#define S2S_PATH_KEY_DIR "/usr/vurn/etc/.encrypt"           /* encrypted shares' key files */
#define S2S_PATH_RUN_DIR "/var/run/s2s"                     /* pid files of services (no systemd) */
#define S2S_PATH_SERVICE_DIR "/usr/vurn/bin"                /* service executables (no systemd) */
#define S2S_PATH_SHARE_REGISTRY "/etc/s2s/shares.conf"      /* one section per share */
#define S2S_PATH_HOST_CONF "/etc/s2s/host.conf"             /* host facts */
#define S2S_PATH_DMI_SERIAL "/sys/class/dmi/id/product_serial" /* machine serial number */
#define S2S_PATH_SYSTEMD_RUNTIME "/run/systemd/system" /* present when systemd runs the machine */

/* The path to use for the fixed absolute path `fixedPath`: $S2S_ROOT + fixedPath when the
 * environment variable S2S_ROOT is set and not empty (one trailing slash of it ignored), else
 * fixedPath itself. A relative or null fixedPath is returned unchanged. The result stays valid
 * for the life of the process (it is interned; do not free it), also after S2S_ROOT changes.
 * Null only when out of memory (never the unredirected path then). Thread-safe. */
S2S_EXPORT const char* S2SPath(const char* fixedPath);

/* ---------------------------------------------------------------------------------------------
 * Last platform error (per thread).
 * ------------------------------------------------------------------------------------------- */
#define VLIB_ERR_NONE 0x0000
#define VLIB_ERR_BAD_PARAMETER 0x0100    /* null/empty argument, forbidden characters, bad name */
#define VLIB_ERR_OUT_OF_MEMORY 0x0200    /* an allocation failed */
#define VLIB_ERR_FILE_NOT_FOUND 0x0300   /* the file to read does not exist */
#define VLIB_ERR_ACCESS 0x0400           /* permission denied */
#define VLIB_ERR_IO 0x0500               /* another system call failed (read, write, fsync, ...) */
#define VLIB_ERR_BUFFER_TOO_SMALL 0x0600 /* the caller's buffer cannot hold the result */
#define VLIB_ERR_RESOLVE 0x0700          /* name resolution failed */
#define VLIB_ERR_SEMAPHORE 0x0800        /* a System V semaphore call failed */
#define VLIB_ERR_NOT_FOUND 0x2200        /* the section, key or share record is absent */
#define VLIB_ERR_BAD_FORMAT 0x2201       /* a file holds a line or value it cannot parse */
#define VLIB_ERR_NAME_TAKEN 0x2202       /* another share's name differs only in case/blanks */
#define VLIB_ERR_TOO_LARGE 0x2203        /* the file would outgrow what its readers take */
#define VLIB_ERR_SERVICE_ALREADY 0xEB00  /* the service is already in the wanted state */
#define VLIB_ERR_SERVICE_UNKNOWN 0xEB01  /* no such service (no executable / unit) */
#define VLIB_ERR_SERVICE_FAILED 0xEB02   /* the service manager could not do it */

/* The last platform error of the calling thread (a 16-bit code, printed as "0x%04X"). */
S2S_EXPORT int VLIBCErrGet(void);
/* Sets the calling thread's last platform error (for layers that report through it). */
S2S_EXPORT void VLIBCErrSet(int err);
/* A short English text for a platform error code ("Unknown error" for others). */
S2S_EXPORT const char* VLIBCErrStr(int err);

/* ---------------------------------------------------------------------------------------------
 * Platform strings.
 * ------------------------------------------------------------------------------------------- */
/* A newly allocated string formatted like printf ("%s" with one argument duplicates it); null
 * on a null format or out of memory. Release with VLIBCStrPut. */
S2S_EXPORT char* VLIBCStrGet(const char* format, ...) __attribute__((format(printf, 1, 2)));
/* Releases a string from VLIBCStrGet (or any platform function that says so). Null is ignored. */
S2S_EXPORT void VLIBCStrPut(char* str);

/* ---------------------------------------------------------------------------------------------
 * String tables (key -> value, keys unique, kept in insertion order) and string lists.
 * The size given at allocation is a capacity hint: both grow as needed. Functions taking a
 * pointer-to-pointer may replace the object; always use the updated pointer afterwards.
 * Strings returned by the getters belong to the table/list and stay valid until that entry is
 * changed or removed or the object is freed.
 * ------------------------------------------------------------------------------------------- */
typedef struct VLIBSzHash VLIBSzHash;
typedef struct VLIBSzList VLIBSzList;

/* Null when out of memory or `size` is negative. */
S2S_EXPORT VLIBSzHash* VLIBCSzHashAlloc(int size);
S2S_EXPORT void VLIBCSzHashFree(VLIBSzHash* hash); /* null is ignored */
/* The value of `key`, or null when absent (or on null arguments). */
S2S_EXPORT const char* VLIBCSzHashGetValue(const VLIBSzHash* hash, const char* key);
/* Sets (adds or replaces) `key` = `value`. 0 on success; negative on a null table, a null or
 * empty key, a null value, or out of memory. */
S2S_EXPORT int VLIBCSzHashSetValue(VLIBSzHash** hash, const char* key, const char* value);
/* Removes `key`. 0 when removed, negative when absent (VLIB_ERR_NOT_FOUND) or on bad args. */
S2S_EXPORT int VLIBCSzHashRemove(VLIBSzHash* hash, const char* key);
/* Removes every entry (the table stays allocated). Null is ignored. */
S2S_EXPORT void VLIBCHashRemoveAll(VLIBSzHash* hash);
/* Number of entries (0 for null), and the key / value at `index` in insertion order (null when
 * out of range). */
S2S_EXPORT int VLIBCSzHashCount(const VLIBSzHash* hash);
S2S_EXPORT const char* VLIBCSzHashKeyAt(const VLIBSzHash* hash, int index);
S2S_EXPORT const char* VLIBCSzHashValueAt(const VLIBSzHash* hash, int index);

S2S_EXPORT VLIBSzList* VLIBCSzListAlloc(int size);
S2S_EXPORT void VLIBCSzListFree(VLIBSzList* list); /* null is ignored */
/* Appends a copy of `str`. 0 on success; negative on null arguments or out of memory. */
S2S_EXPORT int VLIBCSzListPush(VLIBSzList** list, const char* str);
S2S_EXPORT void VLIBCSzListRemoveAll(VLIBSzList* list);  /* null is ignored */
S2S_EXPORT int VLIBCSzListCount(const VLIBSzList* list); /* 0 for null */
/* The item at `index`, or null when out of range. */
S2S_EXPORT const char* VLIBCSzListGet(const VLIBSzList* list, int index);

/* ---------------------------------------------------------------------------------------------
 * Section files (format: docs/section-file.md).
 *
 *   [section]
 *   \tkey="value"
 *
 * Sections and pairs keep their order; comment lines (# or ;) and blank lines are kept on
 * rewrite. Reading a file with a line that is none of these fails with VLIB_ERR_BAD_FORMAT and
 * no write ever touches such a file. A file is read up to VLIB_SECTION_FILE_MAX bytes; a write
 * whose result would be larger is refused with VLIB_ERR_TOO_LARGE before anything is written. Every
 * write replaces the whole file atomically (temporary file in the same directory, fsync, rename,
 * fsync of the directory): a reader or a crash sees the old or the new file, never a torn one, and
 * a failed write leaves the old file as it was. Writers of one file are serialised among themselves
 * (an flock on the file being replaced), so two concurrent writes never lose each other's change. A
 * new file is created with mode 0644; a rewritten file keeps its mode (and owner when permitted).
 *
 * Keys: non-empty, no '=', no CR/LF, no leading/trailing blanks. Section names: non-empty, no
 * CR/LF, no leading/trailing blanks. Values: any bytes but CR/LF (a double quote is fine: the
 * value runs to the last quote of its line), at most VLIB_SECTION_VALUE_MAX bytes. Anything
 * else is refused with VLIB_ERR_BAD_PARAMETER before the file is touched.
 *
 * `lineFormat` (the pair format) must be null or exactly VLIB_SECTION_LINE_FORMAT; the file's
 * syntax is fixed, the parameter only states it.
 * ------------------------------------------------------------------------------------------- */
#define VLIB_SECTION_LINE_FORMAT "\t%s=\"%s\"\n"
#define VLIB_SECTION_VALUE_MAX 8192
#define VLIB_SECTION_FILE_MAX (16 * 1024 * 1024)

/* Adds the pairs of section `section` to `*table` (equal keys replaced; the table is not cleared
 * first). 1 when the section exists (even with no pairs), 0 when it is absent (error
 * VLIB_ERR_NOT_FOUND), negative on failure (missing file: VLIB_ERR_FILE_NOT_FOUND). */
S2S_EXPORT int VLIBCFileGetSection(const char* file, const char* section, VLIBSzHash** table);
/* Copies the value of `key` in `section` into buf (size bytes, NUL-terminated). The value's
 * length on success; negative on failure: VLIB_ERR_NOT_FOUND when the section or key is absent,
 * VLIB_ERR_BUFFER_TOO_SMALL when it does not fit (buf then holds ""). */
S2S_EXPORT int VLIBCFileGetSectionValue(const char* file, const char* section, const char* key,
                                        char* buf, int size);
/* Writes the pairs of `table` into a section: each key present in the section gets the new value
 * in place, new keys are appended to it, other keys are kept. The section edited is `oldName`
 * when not null (it is renamed to `section`), else `section`; when it does not exist a section
 * `section` is appended. The file is created when missing. 1 on success, negative on failure. */
S2S_EXPORT int VLIBCFileSetSection(const char* file, const char* section, const char* oldName,
                                   const VLIBSzHash* table, const char* lineFormat);
/* Appends section `section` with the pairs of `table` (the file is created when missing). A
 * section of that name that already exists is not duplicated: the pairs are set in it as by
 * VLIBCFileSetSection. 1 on success, negative on failure. */
S2S_EXPORT int VLIBCFileAddSection(const char* file, const char* section, const VLIBSzHash* table,
                                   const char* lineFormat);
/* Updates an existing section in place: `newName` (when not null) renames it; the keys of
 * `table` present in it get their new values, and the missing ones are appended when `addKeys`
 * is non-zero (else ignored). 1 on success, 0 when the section is absent (nothing written, error
 * VLIB_ERR_NOT_FOUND), negative on failure. `lineFormat` as above. */
S2S_EXPORT int VLIBCIFileModifySection(const char* file, const char* section, const char* newName,
                                       const VLIBSzHash* table, int addKeys,
                                       const char* lineFormat);
/* Makes section `section` hold exactly the pairs of `table` (appended when absent; the file is
 * created when missing). 1 on success, negative on failure. */
S2S_EXPORT int VLIBCFileReplaceSection(const char* file, const char* section,
                                       const VLIBSzHash* table, const char* lineFormat);
/* Removes section `section` with its pairs. 1 when removed, 0 when absent (nothing written,
 * error VLIB_ERR_NOT_FOUND), negative on failure. */
S2S_EXPORT int VLIBCFileRemoveSection(const char* file, const char* section);
/* Pushes the section names, in file order, onto `*list` (not cleared first). The number of
 * sections, or negative on failure (missing file: VLIB_ERR_FILE_NOT_FOUND). */
S2S_EXPORT int VLIBCFileEnumSection(const char* file, VLIBSzList** list);
/* 1 when `path` exists and is a regular file (symbolic links followed), else 0. */
S2S_EXPORT int VLIBCFileExist(const char* path);
/* Reads `file` once and calls `visit` for each section whose name starts with `prefix` (every
 * section when `prefix` is null or empty), in file order (a name repeated by hand once per
 * header), with the section's `count` pairs as by VLIBCFileGetSection: a caller deciding over
 * many sections sees them all from one version of the file. `visit` returns 0 to go on; any other
 * value ends the walk and is returned. 0 after the last section, negative on failure (missing
 * file: VLIB_ERR_FILE_NOT_FOUND). */
typedef int (*VLIBSectionVisitor)(void* arg, const char* section, int count,
                                  const char* const* keys, const char* const* values);
S2S_EXPORT int VLIBCFileVisitSections(const char* file, const char* prefix,
                                      VLIBSectionVisitor visit, void* arg);

/* Replaces the file `path` whole by the `size` bytes at `data`, so that a crash at any moment
 * leaves the old content or the new one under its name, never a mix: a temporary file with a
 * unique name is created beside it (exclusively, never through a symbolic link) with `mode`
 * (not subject to the umask), written, synced, renamed over `path`, and the directory synced.
 * 0; -1 on failure with errno set and the last platform error (the old file then stays as it
 * was, and no temporary file is left). */
S2S_EXPORT int S2SFileReplace(const char* path, const void* data, size_t size, unsigned int mode);

/* ---------------------------------------------------------------------------------------------
 * Cross-process semaphores (System V, one binary semaphore per integer key, created on first
 * open with permission 0600 and kept by the system). Locks are taken with SEM_UNDO: a process
 * that dies while holding one releases it. A handle is used by one thread at a time.
 * ------------------------------------------------------------------------------------------- */
typedef struct VLIBSem VLIBSem;

/* Opens (creating when needed) the semaphore of `key` (not IPC_PRIVATE). Null on failure. */
S2S_EXPORT VLIBSem* VLIBCSemOpen(int key);
/* Blocks until the semaphore is taken (signals do not interrupt it). 0 or negative. Taking it
 * again through the same handle while holding it fails (VLIB_ERR_BAD_PARAMETER) instead of
 * deadlocking. */
S2S_EXPORT int VLIBCSemLock(VLIBSem* sem);
/* Releases it. 0, or negative when this handle does not hold it or the call fails. */
S2S_EXPORT int VLIBCSemUnlock(VLIBSem* sem);
/* Releases the lock when this handle still holds it, then frees the handle. 0; null ignored. */
S2S_EXPORT int VLIBCSemClose(VLIBSem* sem);
/* Removes the semaphore of `key` from the system (tests and uninstall). 0, or negative. */
S2S_EXPORT int VLIBCSemRemove(int key);

/* ---------------------------------------------------------------------------------------------
 * Processes and services.
 * ------------------------------------------------------------------------------------------- */
/* Non-zero when the pid file exists, holds a positive decimal pid (surrounding blanks allowed)
 * and that process exists and is not a zombie; 0 otherwise (missing or garbage file too). */
S2S_EXPORT int VLIBCProcAliveByPidFile(const char* pidFile);

/* Service control. With systemd running the machine (S2S_PATH_SYSTEMD_RUNTIME exists and
 * S2S_ROOT is not set) the service is the unit `name` and `systemctl` does the work. Otherwise
 * the service is the executable S2SPath(S2S_PATH_SERVICE_DIR)/name, started detached (own
 * session, standard streams on /dev/null, environment inherited, running in the foreground) and
 * tracked by the pid file S2SPath(S2S_PATH_RUN_DIR)/name.pid, written by the platform.
 * Names: [A-Za-z0-9_.@-]+, not starting with '.' or '-'. */
/* Starts the service. 0 on success; non-zero on failure: VLIB_ERR_SERVICE_ALREADY when it runs
 * already, VLIB_ERR_SERVICE_UNKNOWN without executable, VLIB_ERR_SERVICE_FAILED otherwise.
 * `flags` is reserved (0). */
S2S_EXPORT int VLIBServiceStart(const char* name, int flags);
/* Stops the service without removing it (SIGTERM, then SIGKILL after 10 seconds; the pid file is
 * removed). 0 on success; non-zero on failure, VLIB_ERR_SERVICE_ALREADY when it is not running. */
S2S_EXPORT int VLIBServicePause(const char* name);
/* 1 when the service runs, 0 when not, negative on error. */
S2S_EXPORT int VLIBServiceIsRunning(const char* name);

/* ---------------------------------------------------------------------------------------------
 * Share records, read from the share registry S2SPath(S2S_PATH_SHARE_REGISTRY): one section per
 * share, named by the share, keys:
 *   path           the share's mount path (absolute)
 *   encrypted      yes/no
 *   encrypted_path the encrypted (lower) directory; default: "@" + name + "@" next to path
 *   auto_mount     yes/no (encrypted share mounted automatically)
 *   acl            yes/no
 *   win_share      yes/no
 *   key_len        decimal encryption key length
 *   key_file       stored key file; default S2SPath(S2S_PATH_KEY_DIR)/<name>.key
 *   auto_key_file  key file for automatic mounting;
 *                  default S2SPath(S2S_PATH_KEY_DIR)/<name>.auto.key
 *   in_sharebin    yes/no
 *   special_files  yes/no: the receiving daemon keeps setuid/setgid bits of files it receives
 *                  into this share, and may create device files (off: it strips the bits and,
 *                  unless some other share asks, cannot create device files at all)
 * Absent keys read as empty / "no" / 0. Share names: valid UTF-8, 1..VURN_SHARE_NAME_MAX bytes, no
 * control characters, none of / \ [ ], not "." or "..", no leading/trailing blanks. A missing or
 * unreadable registry is a failure (VLIB_ERR_FILE_NOT_FOUND / VLIB_ERR_ACCESS, with an ERROR line);
 * a malformed value is VLIB_ERR_BAD_FORMAT.
 * ------------------------------------------------------------------------------------------- */
#define VURN_SHARE_NAME_MAX 255
#define VURN_SHARE_STATUS_ENCRYPTED 0x2
#define VURN_SHARE_STATUS_AUTO_MOUNT 0x4
#define VURN_SHARE_STATUS_ACL 0x80
#define VURN_SHARE_STATUS_WIN_SHARE 0x800
#define VURN_SHARE_STATUS_SPECIAL_FILES 0x1000

typedef struct VURNShare {
    char* name;          /* the share name */
    char* path;          /* mount path ("" when the registry has none) */
    unsigned int status; /* VURN_SHARE_STATUS_* bits */
    unsigned int keyLen; /* encryption key length */
    char* encryptedPath; /* as stored ("" when not set) */
    char* keyFile;       /* as stored ("" when not set) */
    char* autoKeyFile;   /* as stored ("" when not set) */
    int inSharebin;      /* 1 or 0 */
} VURNShare;

/* Looks a share up. 0 and *share set to a new record (release with VURNShareFree); negative on
 * failure with *share null: VLIB_ERR_NOT_FOUND when the registry has no such share. */
S2S_EXPORT int VURNShareGet(const char* name, VURNShare** share);
S2S_EXPORT void VURNShareFree(VURNShare* share); /* null is ignored */
/* The encrypted directory of the share whose mount path is `sharePath` (its encrypted_path, or
 * the default), copied into buf. Its length, or negative (VLIB_ERR_NOT_FOUND when no share of
 * the registry has that path). */
S2S_EXPORT int VLIBShareEncryptPathGet(const char* sharePath, char* buf, int size);
/* 1 when the share is in the share bin, 0 when not, negative on failure. */
S2S_EXPORT int VURNShareIsInSharebin(const char* name);
/* *value = 1/0 for the encrypted / auto-mount state of a record. 0, or negative on null args. */
S2S_EXPORT int VLIBShareIsEncryptionGet(const VURNShare* share, int* value);
S2S_EXPORT int VLIBShareIsAutoDecryptGet(const VURNShare* share, int* value);
/* The path of the share's stored key file / auto-mount key file (the default when unset) into
 * buf. Its length, or negative. Key files are never read by the platform. */
S2S_EXPORT int VURNShareEncKeyFileGet(const VURNShare* share, char* buf, int size);
S2S_EXPORT int VURNShareEncAutoKeyFileGet(const VURNShare* share, char* buf, int size);

/* Registry management (the administration tool). `attrs` holds registry keys (above) only;
 * values are checked (booleans yes/no, key_len decimal, paths absolute). */
/* Creates or replaces the record of `name` with exactly `attrs`. 0, or negative. */
S2S_EXPORT int VURNShareSet(const char* name, const VLIBSzHash* attrs);
/* Removes the record. 0; negative when absent (VLIB_ERR_NOT_FOUND) or on failure. */
S2S_EXPORT int VURNShareRemove(const char* name);
/* Pushes the share names in registry order onto *names. Their number, or negative. */
S2S_EXPORT int VURNShareEnum(VLIBSzList** names);
/* 1 when `name` is acceptable as a share name, else 0. */
S2S_EXPORT int VURNShareNameIsValid(const char* name);

/* Share names on the wire. The receiving rsync daemon serves each share as a module of the
 * share's name, and its configuration reader folds module names: ASCII letter case and blanks
 * do not count ("docs", "DOCS" and "d ocs" are one module, the last path given wins), and a run
 * of blanks in a name becomes one blank (a share "a  b" would be served as "a b"). Both ends
 * use these two rules:
 * - VURNShareNameIsSyncable: 1 when `name` can be synced at all: a valid share name without
 *   quotes, backquotes, '%', ':' (it joins share names on the wire) or "..", not starting
 *   with '@' (reserved for the service's own modules and for encrypted shares' "@name@"),
 *   without a run of blanks, and not "global" in any case.
 * - VURNShareModuleKey: the folded form (ASCII lower case, blanks removed) into buf; two shares
 *   with one key would be one module. Its length, or negative (VLIB_ERR_BUFFER_TOO_SMALL).
 * VURNShareSet refuses a name whose key equals another registered share's (VLIB_ERR_NAME_TAKEN);
 * VURNShareNameCollision finds that share: 1 with its name in buf, 0 when there is none,
 * negative on failure. */
S2S_EXPORT int VURNShareNameIsSyncable(const char* name);
S2S_EXPORT int VURNShareModuleKey(const char* name, char* buf, int size);
S2S_EXPORT int VURNShareNameCollision(const char* name, char* buf, int size);

/* ---------------------------------------------------------------------------------------------
 * Host facts, from S2SPath(S2S_PATH_HOST_CONF):
 *   [host]     serial=..., ha=yes|no, model_class=... ("portbox" selects the share-bin rule)
 *   [volumes]  <mount path>=internal|external, or internal,directory|external,directory for a
 *              volume that is a plain directory of a larger file system (not a mount point)
 * A missing host file means no facts (no serial, not HA, ordinary model class, no volume
 * overrides); an unreadable or malformed one is a failure with an ERROR line.
 * ------------------------------------------------------------------------------------------- */
/* The machine serial number into buf (at most size-1 bytes; a longer serial is cut): host.conf's
 * serial, else the DMI product serial (S2S_PATH_DMI_SERIAL) when readable and not a placeholder,
 * else "" (no serial). Serials name the machine towards servers: every byte other than an ASCII
 * letter, digit, '-', '_', '.' or ':' (blanks in virtual machines' serials) is given as '-'. 0, or
 * negative on bad arguments or an unreadable host file (buf ""). */
S2S_EXPORT int VLIBGetSerialNumber(char* buf, int size);
/* 1 when host.conf says ha=yes, else 0 (also when it cannot be read: logged). */
S2S_EXPORT int VURNHAIsRunning(void);
/* 1 when host.conf's model_class is "portbox", else 0 (also when it cannot be read: logged). */
S2S_EXPORT int VLIBCIsPortBox(void);
/* The model class text ("" when unset) into buf. Its length, or negative. */
S2S_EXPORT int VLIBGetModelClass(char* buf, int size);

/* The system host name (gethostname) into buf, which must hold VURN_HOSTNAME_MAX bytes; a longer
 * name is cut. 0, or negative. */
#define VURN_HOSTNAME_MAX 64
S2S_EXPORT int VURNLnxGetHostname(char* buf);

/* Network interfaces (getifaddrs; loopback skipped; physical devices first, then virtual ones,
 * each in interface index order). */
#define VLIB_NETIF_WITH_MAC                                              \
    0x1 /* flag: only interfaces with a non-zero 6-byte hardware address \
         */
typedef struct VLIBNetIfInfo {
    char name[16];        /* interface name */
    unsigned char mac[6]; /* hardware address (SIOCGIFHWADDR), zeros when none */
    char ipv4[16];        /* first IPv4 address text, "" when none */
    int up;               /* 1 when the interface is up */
} VLIBNetIfInfo;
/* Fills up to `max` entries of `list`. The number filled (0 when none), or negative. */
S2S_EXPORT int VLIBNetGetInterfaceInfo(VLIBNetIfInfo* list, int max, int flags);

/* Volume holding a path: the longest mount point of /proc/self/mountinfo (or volume path listed
 * in host.conf's [volumes]) that contains the path's real location. The type is
 * VURN_VOLUME_TYPE_INTERNAL unless host.conf's [volumes] says "external" for that path or the
 * device is removable or on USB. */
#define VURN_VOLUME_TYPE_INTERNAL 1
#define VURN_VOLUME_TYPE_EXTERNAL 2
typedef struct VURNVolumeRecord {
    char path[128]; /* the volume's mount path, NUL-terminated */
    int type;       /* VURN_VOLUME_TYPE_* */
} VURNVolumeRecord;
/* 0 and *volume filled; non-zero on failure (missing path, no mount table, a mount path longer
 * than 127 bytes: VLIB_ERR_BUFFER_TOO_SMALL). */
S2S_EXPORT int VolumePathParseEx(const char* path, VURNVolumeRecord* volume);
/* Whether the volume at `volumePath` (a path VolumePathParseEx reported) is there: 1 when it is a
 * mount point of /proc/self/mountinfo or host.conf lists it as a directory volume; 0 when it is
 * not mounted (a listed mount path missing from the mount table, or an unlisted path that is no
 * mount point); negative on failure (unreadable mount table or host file, malformed entry). */
S2S_EXPORT int VURNVolumeIsMounted(const char* volumePath);

/* ---------------------------------------------------------------------------------------------
 * Usable addresses of a server: `serverIP` first when it is a numeric IPv4/IPv6 address, then
 * the IPv4 addresses the resolver (getaddrinfo) gives for `serverName`, without duplicates, at
 * most `max`. A non-empty serverIP that is not an address is skipped with an ERROR line.
 * ------------------------------------------------------------------------------------------- */
typedef struct VURNBkpIPEntry {
    char addr[48]; /* NUL-terminated address text */
    int family;    /* AF_INET or AF_INET6 */
} VURNBkpIPEntry;  /* 52 bytes */
/* The number of entries filled (>= 1), 0 when none is usable (error VLIB_ERR_RESOLVE), or
 * negative on bad arguments. */
S2S_EXPORT int VURNBkpGetUsableIPList(const char* serverName, const char* serverIP,
                                      VURNBkpIPEntry* entries, int max);

#ifdef __cplusplus
} /* extern "C" */
#endif

#endif /* S2S_PLATFORM_H */
