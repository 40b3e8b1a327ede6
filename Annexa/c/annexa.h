/* annexa.h: the C interface of the Annexa client library, for hosts written in languages other
 * than C++. It talks to the per-user daemon axd like the C++ class AXDaemonClient.
 *
 *     cc host.c $(pkg-config --cflags --libs annexa)
 *
 * Values cross this interface in the text notation of messages (docs/rpx-wire.md), for example
 * {"election": 1} or {"request": "bulk", "version": 3u}, or in JSON once a client, a plug-in
 * connection or a plug-in's serving loop is set to ANNEXA_NOTATION_JSON: then every value the
 * library returns is JSON and every value it reads must be, with the tagged objects of
 * docs/rpx-wire.md for what JSON lacks ({"$uuid": "..."}, {"$data": "<base64>"}, ...).
 *
 * Return codes: 0 for success; a positive code is the daemon's error code (docs/client-library.md
 * lists them); ANNEXA_EUNREACHABLE when the daemon cannot be reached (not running, or the
 * connection ended before the reply came); ANNEXA_EINVAL when the caller's arguments are unusable
 * (a null pointer, text that is not one value in the notation, a UUID that does not parse). When
 * `error_text` is not null it receives the error's text on failure (release it with annexa_free)
 * and null on success.
 *
 * A client connects again by itself when a call finds its connection ended, so a host keeps its
 * client across restarts of the daemon.
 *
 * The library writes its log to the journal, or nowhere when there is none; it writes on the
 * host's standard error only after annexa_log_to_stderr(1) or with CORVANE_LOG_SINK=stderr.
 *
 * A client may be used from one thread at a time; separate clients are independent. */
#ifndef ANNEXA_H
#define ANNEXA_H

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define ANNEXA_EINVAL (-1)
#define ANNEXA_EUNREACHABLE (-2)
/* annexa_watch_next: no event came within the time given. */
#define ANNEXA_ETIMEDOUT (-3)

/* How values are written as text: the text notation (the default) or JSON. */
#define ANNEXA_NOTATION_TEXT 0
#define ANNEXA_NOTATION_JSON 1

typedef struct annexa_client annexa_client;

/* Connects to the daemon's endpoint; a null name means "com.corvane.annexa.axd". Returns null only
 * when memory runs out: an unreachable daemon shows in the replies. */
annexa_client* annexa_client_create(const char* service_name);
void annexa_client_destroy(annexa_client* client);
/* Sets the notation of every value this client's calls read and return; ANNEXA_EINVAL for an
 * unknown notation, else 0. */
int64_t annexa_client_set_notation(annexa_client* client, int notation);

/* Sends one message written in the text notation and waits for the reply, which `reply` receives
 * in the same notation (release it with annexa_free). Returns 0 whenever a reply came, whatever it
 * says; ANNEXA_EUNREACHABLE when the daemon cannot be reached, ANNEXA_EINVAL for a message that is
 * not one value (`error_text` then says where it went wrong). */
int64_t annexa_send(annexa_client* client, const char* message, char** reply, char** error_text);

/* Registers bundles (absolute paths): applications with their plug-ins, or plug-ins alone. */
int64_t annexa_add(annexa_client* client, const char* const* paths, size_t count, char** error_text);
/* Unregisters bundles; the daemon serves only callers signed with its manager entitlement. */
int64_t annexa_remove(annexa_client* client, const char* const* paths, size_t count, char** error_text);
/* Sets the same annotations ({"election": N} and/or {"extension": {...}}) on the plug-ins with
 * these UUIDs (text form). */
int64_t annexa_annotate(annexa_client* client, const char* const* uuids, size_t count, const char* annotations,
                        char** error_text);
/* Sets each plug-in's extension dictionary: a dictionary from UUID texts to dictionaries. */
int64_t annexa_bulk_annotate(annexa_client* client, const char* annotations, char** error_text);

/* With a non-zero argument, log lines the journal cannot take go to standard error. */
void annexa_log_to_stderr(int enabled);

/* Discovery: the plug-ins that fit `rules` (a pattern dictionary in the notation, or null for
 * every plug-in) under `flags` (docs/discovery.md). `matches` receives the array of plug-in forms
 * in the notation (release it with annexa_free); each form carries "uuid", "identifier", "version",
 * "path" and the rest of docs/discovery.md. */
int64_t annexa_match(annexa_client* client, const char* rules, uint64_t flags, char** matches, char** error_text);

/* Gets plug-ins (UUID texts) ready for this process: nothing is enabled unless every one may be
 * used (not held, the host authorised). */
int64_t annexa_ready(annexa_client* client, const char* const* uuids, size_t count, char** error_text);
/* Read tokens for the plug-ins' bundles: `tokens` receives an array of strings in the notation. */
int64_t annexa_access(annexa_client* client, const char* const* uuids, size_t count, char** tokens, char** error_text);
/* Holds plug-ins: flags 1 for application paths (refused with code 14 while one of their plug-ins is
 * busy), 2 for plug-in bundle paths. `token` receives the hold's token, for annexa_unlock. */
int64_t annexa_lock(annexa_client* client, const char* const* paths, size_t count, uint64_t flags, char** token,
                    char** error_text);
/* Releases a hold by its token (anyone's); an unknown token is no error. */
int64_t annexa_unlock(annexa_client* client, const char* token, char** error_text);
/* For a running plug-in: the receipt file of the application that contains it; `bytes` (release
 * with annexa_free) receives `size` bytes. */
int64_t annexa_receipt(annexa_client* client, void** bytes, size_t* size, char** error_text);

/* ---- Following the registry: installs, uninstalls, annotations and holds, as they happen */

typedef struct annexa_watch annexa_watch;

/* Subscribes to the daemon's events on a connection of its own, in the client's notation. Null
 * when the daemon cannot be reached or refuses, with the reason in `error_text`. */
annexa_watch* annexa_watch_start(annexa_client* client, char** error_text);
/* A descriptor that polls readable while an event waits, for a host's own event loop. */
int annexa_watch_fd(const annexa_watch* watch);
/* The next event (release it with annexa_free), waiting at most `timeout_ms` milliseconds (-1:
 * without limit). ANNEXA_ETIMEDOUT when none came; ANNEXA_EUNREACHABLE once the daemon ended the
 * watch, or when the host fell so far behind that events were lost (the watch has then ended;
 * match again and start a new one). */
int64_t annexa_watch_next(annexa_watch* watch, int timeout_ms, char** event, char** error_text);
void annexa_watch_stop(annexa_watch* watch);

/* ---- Running plug-ins (docs/spawnd.md) */

/* A host's connection to a running instance of a plug-in. */
typedef struct annexa_plugin annexa_plugin;

/* Connects to an instance of the plug-in with this bundle identifier, which axd got ready for this
 * process; the service manager spawnd starts it when it is not running. Null on failure, with the
 * reason (spawnd's, e.g. that the plug-in crashed before accepting) in `error_text`. */
annexa_plugin* annexa_plugin_connect(const char* bundle_identifier, char** error_text);
/* Sends one message in the text notation to the plug-in and waits for its reply, which `reply`
 * receives in the notation. ANNEXA_EUNREACHABLE when the plug-in's connection ended. */
int64_t annexa_plugin_send(annexa_plugin* plugin, const char* message, char** reply, char** error_text);
void annexa_plugin_close(annexa_plugin* plugin);
/* Sets the notation of the messages and replies of this connection; ANNEXA_EINVAL for an unknown
 * notation, else 0. */
int64_t annexa_plugin_set_notation(annexa_plugin* plugin, int notation);

/* The plug-in's side. The handler receives each message from a host in the text notation and
 * returns the reply in the notation, allocated with malloc (the library frees it), or null to reply
 * {}. Handlers run one at a time, on a thread of the library. */
typedef char* (*annexa_plugin_handler)(const char* message, void* context);
/* Serves host connections until spawnd ends the instance, then returns 0; ANNEXA_EINVAL at once when
 * this process was not launched by spawnd. */
int64_t annexa_plugin_run(annexa_plugin_handler handler, void* context);
/* The same in either notation: the handler receives and returns text in `notation`. */
int64_t annexa_plugin_serve(annexa_plugin_handler handler, void* context, int notation);
/* Busy assertions: while one is held, the instance is reported busy with its reason. */
uint64_t annexa_plugin_begin_busy(const char* reason);
void annexa_plugin_end_busy(uint64_t assertion);

/* Releases text returned by this interface. */
void annexa_free(void* text);
/* A copy of `text` that the library may release: what a handler written in another language
 * returns, since the library frees the reply with free(). Null when memory runs out. */
char* annexa_copy_text(const char* text);

#ifdef __cplusplus
}
#endif

#endif /* ANNEXA_H */
