#ifndef BEXIL_BEXIL_C_H
#define BEXIL_BEXIL_C_H

/* The C interface of libbexil, the client library of bxd, the plug-in registry daemon: for C programs and for
 * languages that bind to C (the Python module `bexil` is built on it). C99, no C++ header; link with
 * `pkg-config --cflags --libs bexil`. bexil-c(3) is its manual.
 *
 * A bexil_client is one connection to the daemon. Every request is synchronous: the calling thread blocks until the
 * reply comes or the client's time limit (30 seconds unless set) runs out. One client may be used from several
 * threads at once; its requests are independent. Values go in and come out as JSON text: numbers, strings, arrays
 * and objects as usual; data as base64 text, dates as ISO 8601 text and UUIDs as their canonical text.
 *
 * Ownership: text a call hands out through a `char **` is the caller's, to release with bexil_free(); an error
 * handed out through a `bexil_error **` is the caller's, to release with bexil_error_free(); a socket handed out by
 * bexil_launch() is the caller's, to close(). Every out-parameter may be NULL when the caller does not want it.
 * Text handed in is only read during the call.
 *
 * Errors: every request returns BEXIL_OK (0) or the error's code, and on failure fills in *error when `error` is not
 * NULL. A NULL client or argument, text that is not JSON, or a malformed UUID is refused with
 * BEXIL_ERROR_INVALID_REQUEST and a message naming the argument; nothing is sent then. */

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* The codes of failed requests: the daemon's, and the library's own with the same meaning. */
enum {
    BEXIL_OK = 0,
    /* The registry refused a registration change, or a plug-in named by UUID text is unknown. */
    BEXIL_ERROR_REGISTRY_REFUSED = 2,
    /* A malformed request or argument, an operation that failed inside the daemon, or no reply at all (see
     * bexil_error_no_reply). */
    BEXIL_ERROR_INVALID_REQUEST = 4,
    BEXIL_ERROR_BAD_INTERFACE_SPEC = 6,
    BEXIL_ERROR_VERSION_MISMATCH = 7,
    /* A bad path, or nothing at the path. */
    BEXIL_ERROR_BAD_PATH = 9,
    /* The caller is not allowed (an entitlement is missing). */
    BEXIL_ERROR_NOT_ALLOWED = 11,
    BEXIL_ERROR_INVALID_CONFIGURATION = 12,
    /* Plug-ins are busy (bexil_hold with BEXIL_HOLD_REFUSE_BUSY). */
    BEXIL_ERROR_PLUGINS_BUSY = 14,
    BEXIL_ERROR_BAD_BULK_ANNOTATION = 18
};

/* Flags of bexil_match. */
#define BEXIL_DISCOVER_ALL_VERSIONS UINT64_C(0x1)
#define BEXIL_DISCOVER_ALL_INSTANCES UINT64_C(0x4)
#define BEXIL_DISCOVER_SYSTEM_ONLY UINT64_C(0x8)
#define BEXIL_DISCOVER_ALL UINT64_C(0x200)
/* Flags of bexil_hold. */
#define BEXIL_HOLD_PLUGIN_PATHS UINT64_C(0x1)
#define BEXIL_HOLD_REFUSE_BUSY UINT64_C(0x2)
#define BEXIL_HOLD_TERMINATE UINT64_C(0x4)

/* The time limit of a new client's requests. */
#define BEXIL_DEFAULT_TIMEOUT_MS 30000u

typedef struct bexil_client bexil_client;
typedef struct bexil_error bexil_error;

/* Called with the notification's name, its counter and the context given to bexil_observe. */
typedef void (*bexil_observer)(const char* name, uint64_t counter, void* context);

/* The library's version as "major.minor.patch"; static text. */
const char* bexil_version(void);

/* ---- errors ---- */

/* The error's code (one of the BEXIL_ERROR_ codes, or another the daemon sent); 0 for NULL. */
int bexil_error_code(const bexil_error* error);
/* What went wrong, in one line; "" for NULL. Valid until the error is freed. */
const char* bexil_error_message(const bexil_error* error);
/* Nonzero when no reply came: bxd is not running, went away, or did not answer within the time limit. */
int bexil_error_no_reply(const bexil_error* error);
/* The daemon's reply that reported the failure, as JSON (a refused hold lists its "conflicts" there); NULL when no
 * reply came or the library refused the request itself. Valid until the error is freed. */
const char* bexil_error_reply(const bexil_error* error);
void bexil_error_free(bexil_error* error);

/* Releases text the library handed out; NULL is ignored. */
void bexil_free(void* text);

/* ---- the client ---- */

/* A client of the daemon on `service`, or on its default service when `service` is NULL or "". Making one does not
 * check that bxd runs: a request that finds no daemon fails, and bexil_error_no_reply() says so. */
bexil_client* bexil_client_new(const char* service, bexil_error** error);
/* Ends the client: waits for a running observer callback to return, and none is called afterwards. Requests still
 * waiting in other threads must have returned. Not from an observer callback. NULL is ignored. */
void bexil_client_free(bexil_client* client);
/* The service the client talks to; valid as long as the client. NULL for NULL. */
const char* bexil_client_service(const bexil_client* client);
/* Sets how long each later request waits for its reply (more than 0 milliseconds). */
int bexil_client_set_timeout(bexil_client* client, uint32_t milliseconds, bexil_error** error);

/* ---- requests ----
 * Each sends one request, waits for its reply and hands the reply dictionary out as JSON through `reply_json`.
 * Paths are absolute; UUIDs are canonical text. `count` items are read from `paths` or `uuids` (which may be NULL
 * when `count` is 0). None may be called from an observer callback: it would wait for the thread it runs on, so it
 * fails at once instead. */

/* Registers the plug-in bundles at `paths`. */
int bexil_add(bexil_client* client, const char* const* paths, size_t count, char** reply_json, bexil_error** error);
/* Unregisters them; needs the manager entitlement. */
int bexil_remove(bexil_client* client, const char* const* paths, size_t count, char** reply_json, bexil_error** error);
/* The bulk registration request. */
int bexil_bulk(bexil_client* client, uint64_t flags, char** reply_json, bexil_error** error);
/* Makes plug-ins ready for the calling process (for bexil_launch). */
int bexil_ready(bexil_client* client, const char* const* uuids, size_t count, char** reply_json, bexil_error** error);
/* Read-only access tokens for plug-ins, under "extensions" in the reply. */
int bexil_access(bexil_client* client, const char* const* uuids, size_t count, char** reply_json, bexil_error** error);
/* Discovers the plug-ins that match `rules_json` (an object; "{}" matches all): the reply's "matches" is the array
 * of their forms ("identifier", "uuid", "path", "version", "annotations"...). */
int bexil_match(bexil_client* client, const char* rules_json, uint64_t flags, char** reply_json, bexil_error** error);
/* Sets the annotations (an object: "election", "extension") of plug-ins. */
int bexil_annotate(bexil_client* client, const char* const* uuids, size_t count, const char* annotations_json,
                   char** reply_json, bexil_error** error);
/* Sets the annotations of many plug-ins: an object from UUID text to annotations. */
int bexil_bulk_annotate(bexil_client* client, const char* annotations_json, char** reply_json, bexil_error** error);
/* Holds plug-ins (or the plug-ins of applications) out of use; the hold's UUID is the reply's "uuids". */
int bexil_hold(bexil_client* client, const char* const* paths, size_t count, uint64_t flags, char** reply_json,
               bexil_error** error);
/* Releases a hold placed by this client. */
int bexil_release_hold(bexil_client* client, const char* hold_uuid, char** reply_json, bexil_error** error);
/* The holds in force, under "holds"; needs the manager entitlement. */
int bexil_holds(bexil_client* client, char** reply_json, bexil_error** error);
/* What bxd is doing now: "uptime", "connections", "served", "cachedRecords", "cacheLimit", "holdCount",
 * "registered". Any client may ask. */
int bexil_status(bexil_client* client, char** reply_json, bexil_error** error);
/* Starts a plug-in that bexil_ready made ready for this process, in its sandbox: *pid is the started instance and
 * *channel the caller's end of a connected socket to it (close-on-exec; the caller closes it). When `channel` is
 * NULL the socket is closed, which ends the plug-in's conversation. */
int bexil_launch(bexil_client* client, const char* uuid, int64_t* pid, int* channel, char** reply_json,
                 bexil_error** error);

/* ---- notifications ---- */

/* Calls `callback` each time `name` is posted (for example "com.quorvel.bexil.annotation-change") until
 * bexil_stop_observing or bexil_client_free. It runs on a thread of the library, one call at a time per client,
 * and must return soon and make no request: hand the news to a thread of your own. *token names the observation. */
int bexil_observe(bexil_client* client, const char* name, bexil_observer callback, void* context, uint64_t* token,
                  bexil_error** error);
/* Ends an observation: once it returns the callback is not running (unless this is called from that very callback)
 * and is not called again. An unknown token is an error. */
int bexil_stop_observing(bexil_client* client, uint64_t token, bexil_error** error);

#ifdef __cplusplus
}
#endif

#endif /* BEXIL_BEXIL_C_H */
