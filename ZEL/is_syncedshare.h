/* The pairing registry: what a server remembers about the clients that sync into it.
 *
 * The registry is the section file /usr/tarq/etc/tarqZEL.info (below the root folder, when there is
 * one):
 *
 *   [PairedClientInfo]    zelEnabled "yes" or "no", clientID, serverName
 *   [SHARE_<share>]       RunningID: the client whose sync into the share is in progress;
 * CompleteID: the last to end [TASK_<task>]         status: "idle", or when the task last reported,
 * in seconds since the epoch [CLIENTID_<client>]   ServerName: what this client of a multi-source
 * pairing calls the server
 *
 * clientID and serverName both being "ZELMULTI-SRC-SUPPORT" means that every client has a section
 * of its own and none owns the pairing.
 *
 * C linkage throughout. All functions may be called from any thread of any process: writers take
 * one semaphore around each write, readers take none and see the file as it was between two writes.
 * Strings, hashes and lists stay the caller's, unless said otherwise. Failures are reported by the
 * result and in the system log, at priority error.
 */
#pragma once

#include "tarq/core.h"

#ifdef __cplusplus
extern "C" {
#endif
#pragma GCC visibility push(default)

/* ---- The file and its sections ---- */

/* Makes the registry, empty, when there is none. 0: it exists; -1: it cannot be made. */
int ZELCheckServerInfo(void);
/* Adds the section's keys and values to `into`; makes the file when there is none. Positive: read;
 * 0: there is no such section; negative: failure. */
int ZELGetServerInfo(const char* section, KAPICSzHash into);
/* Replaces the section by `values`, or appends it; keys that `values` lacks are gone. An empty
 * section name always appends. 0 or -1. */
int ZELUpdateServerInfo(const char* section, KAPICSzHash values);
/* Copies one value of the share's section, cut to size - 1 bytes, into `buffer`. 0, or negative;
 * KAPICErrGet() then tells absence (0x2200 no section, 0x2000 no key) from failure. A NULL or a
 * size below 1 gives -1 and touches nothing. */
int ZELServerGetShare(const char* share, const char* key, char* buffer, int size);
/* Replaces the share's section. 0 or -1. */
int ZELServerUpdateShare(const char* share, KAPICSzHash values);
/* Replaces the task's section. 0 or -1. */
int ZELServerUpdateTask(const char* task, KAPICSzHash values);

/* Turns the service on or off. With both names given (neither NULL) they are recorded as the paired
 * client and the name it calls the server by; otherwise what is recorded stays. 0 or -1. */
int TARQUISetZEL(int enable, const char* clientID, const char* serverName);
/* 1 when a client is syncing into the share now and the service is not switched off, else 0. A
 * registry that cannot be read gives 0. */
int TARQZELIsSyncedShare(const char* share);
/* Copies at most the first 32 characters of `source` to `target`, A to Z in lower case, up to the
 * terminator, which is not copied: `target` is a zeroed buffer of 33 bytes. */
void getLowerString(const char* source, char* target);

/* ---- Admission ---- */

/* What the functions of this part return. */
enum ZELPairResult {
    ZEL_PAIR_OK = 0,
    ZEL_PAIR_NO_MEMORY = 200,    /* a hash cannot be allocated */
    ZEL_PAIR_BAD_ARGUMENT = 201, /* an argument is NULL or empty */
    ZEL_PAIR_BAD_VALUE = 202,    /* clientID or serverName is missing, or a value cannot be set */
    ZEL_PAIR_WRITE_FAILED = 205, /* the registry cannot be written */
    ZEL_PAIR_READ_FAILED = 206,  /* the registry cannot be read, or lacks what it must hold */
    ZEL_PAIR_CONFLICT = 214      /* some shares may not be paired */
};

/* Empties *refused and puts into it the shares of the list that this client may not pair: those
 * that another client is syncing into, under that name or one that differs in letter case within
 * the first 32 characters. A share without a name is refused as "". 0: all may be paired; 214: some
 * are refused; 201: bad argument; 206: the check could not be finished, and nothing may be
 * concluded. */
int ZELCheckIfSharePaired(KAPICSzList shares, const char* clientID, KAPICSzList* refused);
/* 1: a single client owns the pairing; 0: none does, or the server is in multi-source mode; -1:
 * failure. */
int ZELServerIfOldClientPaired(void);
/* Records the "clientID" and "serverName" of `pair` as the single pairing; the other keys of
 * PairedClientInfo stay. 0, 200, 201, 202, 205 or 206. */
int ZELServerSetPairValue(KAPICSzHash pair);
/* Records a client of a multi-source pairing and puts the server in multi-source mode: two writes,
 * the client's section first. 0, 200, 201, 202 or 205. */
int ZELServerUpdatePairInfo(const char* clientID, const char* serverName);

/* ---- Status ---- */

typedef struct zel_svr_status {
    int enabled;       /* 1 when the service is switched on and the rsync daemon is alive, else 0 */
    int busy;          /* 1 when a task reported within the last 120 seconds, else 0 */
    char* client_id;   /* the paired client, or NULL; freed by zel_svr_put_status */
    char* server_name; /* what it calls this server, or NULL; freed by zel_svr_put_status */
} zel_svr_status;

/* Fills the record. 0, or -1 when the pairing cannot be read: `enabled` is set, and there are no
 * texts. */
int zel_svr_get_status(zel_svr_status* status);
/* Frees the record's texts; the pointers stay as they were. NULL is allowed. Always 0. */
int zel_svr_put_status(zel_svr_status* status);
/* Puts the server in multi-source mode and gives the single client that is paired a section of its
 * own: two writes. The section is appended whether or not there is one of that name; on a server in
 * multi-source mode already it is one for the marker itself. 0 or -1. */
int zel_svr_reset_pair(void);

#pragma GCC visibility pop
#ifdef __cplusplus
}
#endif
