/* Shares and volumes of the host platform layer.
 *
 * Shares are described by the share configuration, the section file
 * /etc/s2s/shares.conf under the root: one section per share, named after
 * the share, with the keys listed in platform/README.md. Paths in it are real
 * paths, used as they stand (not resolved under the root), so a test root
 * may point its shares anywhere. Volumes come from the share's "volume" key,
 * else from the mount table (/etc/mtab under the root when it can be read,
 * else /proc/self/mounts).
 *
 * A share record (KARO_SHARE) is allocated by KAROShareGet and owned by the
 * caller, who releases it with KAROShareFree. Every failure returns -1 and
 * sets the platform error (karo_err.h). Nothing is cached: the file is read
 * at every call. Thread-safe. */
#ifndef KARO_SHARE_H_
#define KARO_SHARE_H_

#include "karo_section.h"

#ifdef __cplusplus
extern "C" {
#endif

#define KARO_SHARE_CONF "/etc/s2s/shares.conf"
/* Where key files live when the configuration names none (under the root). */
#define KARO_SHARE_KEY_DIR "/usr/karo/etc/.encrypt"

/* Status bits of a share record. */
enum {
  KARO_SHARE_ENCRYPTED = 0x2,
  KARO_SHARE_AUTO_MOUNT = 0x4,
  KARO_SHARE_ACL = 0x80,
  KARO_SHARE_WIN_SHARE = 0x800,
  KARO_SHARE_CLUSTER = 0x8000
};

/* What the configuration says of one share. Strings are NULL when the key
 * is absent. */
typedef struct KARO_SHARE {
  char* name;
  char* path;
  unsigned int status;     /* KARO_SHARE_* bits */
  unsigned int key_length; /* "key_length", 0 when absent */
  char* enc_path;          /* "enc_path" */
  char* key_file;          /* "key_file" */
  char* auto_key_file;     /* "auto_key_file" */
  char* volume;            /* "volume" */
  int volume_type;         /* "volume_type", 0 when absent */
  int in_sharebin;         /* "sharebin" is "yes" */
} KARO_SHARE;

/* The volume a path lies on. */
typedef struct KARO_VOLUME {
  char path[1024]; /* mount path, e.g. /volume1 */
  int type;        /* KARO_VOLUME_* */
} KARO_VOLUME;

enum {
  KARO_VOLUME_INTERNAL = 1, /* a volume of the appliance's own disks */
  KARO_VOLUME_OTHER = 2     /* anything else: virtual, network, removable */
};

/* 1 when `name` can name a share: 1-255 bytes, not "." or "..", without
 * '/', '\\', '[', ']', '"', '=', '@' or control characters, and without
 * leading or trailing blanks. Names from the network are checked with this
 * before they are looked up. Else 0 (KERR_INVALID_ARG). */
int KaroShareNameValid(const char* name);

/* Reads the share `name` into a newly allocated record in *out. Returns 0,
 * or -1 with *out NULL: KERR_INVALID_ARG (bad name), KERR_NOT_FOUND (no such
 * share), KERR_FILE_NOT_FOUND (no share configuration), KERR_FILE_FORMAT,
 * KERR_NO_MEMORY. */
int KAROShareGet(const char* name, KARO_SHARE** out);

/* Releases a record from KAROShareGet; NULL is ignored. */
void KAROShareFree(KARO_SHARE* share);

/* Appends the name of every configured share, in file order, to `out`.
 * Returns the number of shares (0 without a configuration), or -1
 * (KERR_FILE_FORMAT, KERR_INVALID_ARG, KERR_NO_MEMORY). */
int KAROShareEnum(KSZLIST* out);

/* Writes the encrypted (lower) directory of the share at `share_path` into
 * `buf`: "enc_path" of the share with that path, else "@<last component>@"
 * beside the share's directory. Returns its length, or -1:
 * KERR_INVALID_ARG (not an absolute path), KERR_BUFFER_TOO_SMALL,
 * KERR_FILE_FORMAT. */
int KLIBShareEncryptPathGet(const char* share_path, char* buf, int size);

/* Sets *value to 1 when the share is encrypted, else 0. Returns 0, or -1
 * with KERR_INVALID_ARG. */
int KLIBShareIsEncryptionGet(const KARO_SHARE* share, int* value);

/* Sets *value to 1 when the share is encrypted and mounted at start-up with
 * a stored key (auto-mount), else 0. Returns 0, or -1 with
 * KERR_INVALID_ARG. */
int KLIBShareIsAutoDecryptGet(const KARO_SHARE* share, int* value);

/* Write the path of an encrypted share's key file ("key_file", else
 * KARO_SHARE_KEY_DIR/<name>.key under the root) or of its stored key for
 * automatic mounting ("auto_key_file", else .../<name>.auto.key) into `buf`.
 * Return the length, or -1: KERR_NOT_FOUND (the share is not encrypted),
 * KERR_BUFFER_TOO_SMALL, KERR_INVALID_ARG. */
int KAROShareEncKeyFileGet(const KARO_SHARE* share, char* buf, int size);
int KAROShareEncAutoKeyFileGet(const KARO_SHARE* share, char* buf, int size);

/* 1 when the share `name` is marked "sharebin" (the shares a reduced
 * appliance may sync), 0 when not, -1 when it cannot be read (errors as for
 * KAROShareGet). */
int KAROShareIsInSharebin(const char* name);

/* Fills `out` with the volume of the share at `path`: the share's "volume"
 * and "volume_type" (type 1 when not given) when the configuration has a
 * share at that path naming its volume, else the mount point that holds
 * `path` as "/NAME", NAME being the mount point's last component or "root"
 * for / (type 1 for a mount of a /dev block device, else 2). Returns 0, or
 * -1: KERR_INVALID_ARG (not an absolute path), KERR_NOT_FOUND (no mount
 * holds it), KERR_BUFFER_TOO_SMALL, KERR_FILE_FORMAT. */
int VolumePathParseEx(const char* path, KARO_VOLUME* out);

#ifdef __cplusplus
}
#endif

#endif /* KARO_SHARE_H_ */
