/* The share catalogue, shares' encryption facts, and volumes.
 *
 * The catalogue is the section file /usr/tarq/etc/tarqshare.conf (below the root folder, see
 * root_path.h), one section a share. C linkage; a failing operation sets the error code of
 * tarq/core.h. Any thread may call.
 */
#pragma once

#include "tarq/core.h"

#ifdef __cplusplus
extern "C" {
#endif
#pragma GCC visibility push(default)

/* Bits of a share's flag word. */
enum TARQShareFlag {
    TARQ_SHARE_ENCRYPTED = 0x2,  /* the share's files are kept encrypted */
    TARQ_SHARE_AUTO_MOUNT = 0x4, /* an encrypted share is opened at start-up, with its key file */
    TARQ_SHARE_ACL = 0x80,       /* files carry access control lists */
    TARQ_SHARE_WINDOWS = 0x800,  /* shared with Windows clients (SMB) */
    TARQ_SHARE_CLUSTER = 0x8000  /* lies on a cluster file system */
};

/* A share as the catalogue has it. The strings are the record's own. */
typedef struct TARQShareRec {
    char* name;         /* as it was asked for */
    char* path;         /* absolute folder; NULL when the catalogue names none */
    unsigned int flags; /* TARQShareFlag bits */
    int enc_key_len;    /* length of the encryption key in bits; 0 for a plain share */
} * TARQShare;

/* The kind of storage that a volume is on. */
enum TARQVolumeType {
    TARQ_VOLUME_UNKNOWN = 0,
    TARQ_VOLUME_INTERNAL = 1, /* a disk of this machine */
    TARQ_VOLUME_EXTERNAL = 2, /* USB, FireWire, memory card, or removable by its own word */
    TARQ_VOLUME_REMOTE = 3    /* another machine's, over the network */
};

typedef struct TARQVolumePath {
    char path[128];    /* the mount path, such as /volume1 */
    unsigned int type; /* TARQVolumeType */
} TARQVolumePath;

/* Finds a share by its exact name. 0, and a record that the caller frees with TARQShareFree; or
 * negative, with *share NULL:
 * TARQ_ERR_NO_SHARE;
 * TARQ_ERR_SHARE_VOLUME when the volume that the share was added on is not mounted there now, so
 * that an empty mount point is never taken for an emptied share;
 * TARQ_ERR_SHARE_FOLDER when the volume is there and the folder is not, so that a folder which was
 * moved away is never taken for one whose files were deleted;
 * TARQ_ERR_SHARE_IDENTITY when another folder stands there than was recorded (one on another disk,
 * or one that was made anew), so that its files are never taken for what became of the share's;
 * TARQ_ERR_BAD_PARAMETER when the section cannot be understood.
 * For an encrypted share it is the folder of the encrypted form that has to be there. A share that
 * has no identity in the catalogue yet is given that of its folder now, by a caller that may write
 * there. */
int TARQShareGet(const char* name, TARQShare* share);
/* Frees a record. NULL is allowed. */
void TARQShareFree(TARQShare share);

/* Adds a share. `path` is an existing readable folder, absolute; links in it are resolved. Its
 * volume (mount path, file system type and, where there is one, UUID) and what the folder itself is
 * known by are recorded. An encrypted share's encrypted form has to be there too, at its default
 * place.
 *
 * A name has 1 to 80 bytes of UTF-8, no control character and none of / : " \ [ ] * ?, does not
 * begin with "." or "@", has no blank at either end nor two side by side, and is neither "global"
 * nor "zel_command". Flag bits without a name are kept.
 *
 * 0, or negative: TARQ_ERR_BAD_PARAMETER; TARQ_ERR_SHARE_EXISTS, also for a name that differs in
 * ASCII capitals alone; TARQ_ERR_SHARE_FOLDER; TARQ_ERR_SHARE_OVERLAP; TARQ_ERR_NO_VOLUME; or a
 * file's. Waits for other writers. */
int TARQShareAdd(const char* name, const char* path, unsigned int flags);
/* Takes a share out of the catalogue; its files stay. 0, or negative (TARQ_ERR_NO_SHARE). Waits for
 * other writers. */
int TARQShareRemove(const char* name);
/* What a share is known by: adds the facts that the catalogue has of the folder whose files travel
 * to `recorded`, and those of the folder that is there now to `now`, under the catalogue's keys
 * (volume, volume_fs, volume_uuid, folder_fs, folder_fsid, folder_inode, folder_birth); what is not
 * known is empty. `now` has that folder's path, too ("path"). 1 when they are the same folder's, 0
 * when they are not, or when nothing of the folder is recorded; negative: TARQ_ERR_NO_SHARE;
 * TARQ_ERR_BAD_PARAMETER; TARQ_ERR_SHARE_FOLDER; TARQ_ERR_NO_VOLUME. */
int TARQShareFactsGet(const char* name, KAPICSzHash recorded, KAPICSzHash now);
/* Records the facts of the folder that is there now in place of those before, when they are still
 * the ones in `seen`. 0, or negative: TARQ_ERR_SHARE_IDENTITY when they have changed since; or as
 * above, or a file's. Waits for other writers. */
int TARQShareConfirm(const char* name, KAPICSzHash seen);
/* Appends the names of all shares, in the catalogue's order, to `into`. 0, or negative. */
int TARQShareEnum(KAPICSzList into);

/* Writes the folder that holds the encrypted form of the encrypted share at `share_path`. 0, or
 * negative: TARQ_ERR_NO_SHARE when no encrypted share has that path; TARQ_ERR_BAD_PARAMETER when
 * the answer does not fit (nothing is ever cut off). */
int KAPIShareEncryptPathGet(const char* share_path, char* buffer, int size);
/* Whether the share is encrypted; whether it is, and is opened at start-up with its key file. 0
 * with *result 1 or 0, or negative. */
int KAPIShareIsEncryptionGet(TARQShare share, int* result);
int KAPIShareIsAutoDecryptGet(TARQShare share, int* result);
/* Write the path of the share's key file: of the one for opening at start-up, of the exported one.
 * The file need not exist. 0, or negative: TARQ_ERR_NO_SHARE; TARQ_ERR_BAD_PARAMETER when the path
 * does not fit. */
int TARQShareEncAutoKeyFileGet(TARQShare share, char* buffer, int size);
int TARQShareEncKeyFileGet(TARQShare share, char* buffer, int size);

/* Finds the volume that `path` (which must exist) lies on: of a file system that shows another
 * folder's files, that folder's. 0, or negative with TARQ_ERR_NO_VOLUME, also when the mount path
 * does not fit; *volume is then left alone. */
int VolumePathParseEx(const char* path, TARQVolumePath* volume);
/* 1 when the share lies on an internal volume, which is where the small device family keeps its
 * shares; else 0. */
int TARQShareIsInSharebin(const char* name);

#pragma GCC visibility pop
#ifdef __cplusplus
}
#endif
