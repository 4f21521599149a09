// SPDX-License-Identifier: Apache-2.0
// The client of zorvaned, the container manager, for C (C99) and for every language that calls C.
//
//     zorvane_error error;
//     zorvane_client *client = zorvane_connect(NULL, ZORVANE_TIMEOUT_DEFAULT, &error);
//     zorvane_result *found = NULL;
//     if (client == NULL || zorvane_call(client, zorvane_request_lookup(ZORVANE_DATA_APPLICATION, ZORVANE_CURRENT_USER,
//                                                                       "org.example.notes", ZORVANE_CREATE),
//                                        &found, &error) != ZORVANE_OK)
//         fprintf(stderr, "%s\n", error.message);
//     else
//         puts(zorvane_result_path(found));
//     zorvane_result_free(found);
//     zorvane_client_free(client);
//
// A command is a request, made by one zorvane_request_ function and handed to zorvane_call, which waits, or to
// zorvane_async_start, which does not. The daemon's identity registry decides what a program may do.
//
// Strings are UTF-8 that ends with a NUL; those that go in are copied. Pointers that an accessor returns belong to the
// object that was asked, and last until it is freed or changed. Objects that a function hands out are the caller's, who
// frees each with the function of its kind; those functions take NULL for nothing to do.
//
// Threads: an object is used by one thread at a time, by any; two threads use two objects at once. Functions that take
// no object may be called by any thread. A child that fork made uses no client or async object of its parent's. A
// thread that waits in the library must not be cancelled with pthread_cancel.
//
// The ABI only grows while the soname is libzorvane.so.0: functions, flags and enumerators are added, none changes or
// goes, and the structures stay as they are.
#pragma once

#include <stddef.h>
#include <stdint.h>

#ifdef __GNUC__
#define ZORVANE_MUST_USE __attribute__((warn_unused_result))
#else
#define ZORVANE_MUST_USE
#endif

#ifdef __cplusplus
extern "C" {
#endif

typedef struct zorvane_client zorvane_client;
typedef struct zorvane_async zorvane_async;
typedef struct zorvane_request zorvane_request;
typedef struct zorvane_result zorvane_result;
typedef struct zorvane_value zorvane_value;

// ---- Errors ----

// How a function ended that returns int, and the kind of an error.
enum {
    ZORVANE_OK = 0,
    // There is no such container or info key.
    ZORVANE_NOT_FOUND = 1,
    // The daemon does not know this program, or does not do this for it.
    ZORVANE_REFUSED = 2,
    // The daemon cannot be reached, or ended while the call waited: what was to change may have been done or not.
    ZORVANE_UNREACHABLE = 3,
    // The command may still be carried out.
    ZORVANE_TIMED_OUT = 4,
    // All else: code says which error of the daemon's, 0 an argument that is not allowed, no memory, or a reply that
    // makes no sense.
    ZORVANE_OTHER = 5
};

// The caller's; every function that takes one takes NULL too. Written when, and only when, the function fails.
typedef struct zorvane_error {
    uint32_t kind;
    uint32_t reserved;
    // The daemon's code, or 0.
    uint64_t code;
    // One sentence for people, without a full stop; cut where it is longer.
    char message[1024];
    // Advice what to do, in the same form; may be empty.
    char advice[1024];
} zorvane_error;

// The meaning of a code of the daemon, how it comes about, what follows, and what to do. Never NULL; static.
const char* zorvane_code_meaning(uint64_t code);
const char* zorvane_code_cause(uint64_t code);
const char* zorvane_code_consequence(uint64_t code);
const char* zorvane_code_advice(uint64_t code);

// The library's version, "0.1.0". Static.
const char* zorvane_version(void);

// ---- Whose containers, and of which class ----

enum {
    ZORVANE_BUNDLE_APPLICATION = 1,
    ZORVANE_DATA_APPLICATION = 2,
    ZORVANE_BUNDLE_KOLVEX_PLUGIN = 3,
    ZORVANE_DATA_KOLVEX_PLUGIN = 4,
    ZORVANE_BUNDLE_VPN_PLUGIN = 5,
    ZORVANE_DATA_VPN_PLUGIN = 6,
    ZORVANE_SHARED_APP_GROUP = 7,
    ZORVANE_BUNDLE_FRAMEWORK = 8,
    ZORVANE_DATA_IPSI_SERVICE = 9,
    ZORVANE_DATA_INTERNAL_DAEMON = 10,
    ZORVANE_DATA_TEMP_DIR = 11,
    ZORVANE_DATA_SYSTEM = 12,
    ZORVANE_SHARED_SYSTEM_GROUP = 13
};
// Number of a class by its name ("Data/Application"), the same as one types it ("data-application"), the beginning of
// one name alone ("data-app"), or its decimal number; 0 when it is none.
uint32_t zorvane_class_by_name(const char* name);
// Static; NULL when there is no such class.
const char* zorvane_class_name(uint32_t container_class);

// In place of a user's number: the current mobile user.
#define ZORVANE_CURRENT_USER UINT32_C(1)
// The user that owns containers of a class when nobody is named, as the daemon of this root (NULL: "/") serves them.
// Reads a small file.
uint32_t zorvane_default_user(uint32_t container_class, const char* root);

// One container. A zorvane_result of a lookup or a list has identifier and uuid.
typedef struct zorvane_address {
    uint32_t container_class;
    uint32_t user;
    const char* identifier;
    uint8_t uuid[16];
} zorvane_address;
// 36 characters, upper-case, and a NUL.
void zorvane_uuid_text(const uint8_t uuid[16], char text[37]);

// ---- Values: what info values and entitlements are made of ----

enum {
    ZORVANE_BOOLEAN = 1,
    ZORVANE_INTEGER = 2,
    // An integer of 2^63 or more.
    ZORVANE_UNSIGNED = 3,
    ZORVANE_REAL = 4,
    ZORVANE_STRING = 5,
    ZORVANE_DATA = 6,
    // Seconds since 2001-01-01 00:00 UTC, which is 978307200 seconds after 1970 began.
    ZORVANE_DATE = 7,
    ZORVANE_LIST = 8,
    ZORVANE_MAP = 9
};

// Each returns NULL when there is no memory; zorvane_value_string also for NULL and for what is no UTF-8.
zorvane_value* zorvane_value_boolean(int value) ZORVANE_MUST_USE;
zorvane_value* zorvane_value_integer(int64_t value) ZORVANE_MUST_USE;
zorvane_value* zorvane_value_unsigned(uint64_t value) ZORVANE_MUST_USE;
zorvane_value* zorvane_value_real(double value) ZORVANE_MUST_USE;
zorvane_value* zorvane_value_string(const char* text) ZORVANE_MUST_USE;
zorvane_value* zorvane_value_data(const void* bytes, size_t size) ZORVANE_MUST_USE;
zorvane_value* zorvane_value_date(double seconds) ZORVANE_MUST_USE;
zorvane_value* zorvane_value_list(void) ZORVANE_MUST_USE;
zorvane_value* zorvane_value_map(void) ZORVANE_MUST_USE;
zorvane_value* zorvane_value_copy(const zorvane_value* value) ZORVANE_MUST_USE;
// Never to be called for a value that a result, a list or a map owns.
void zorvane_value_free(zorvane_value* value);
// Put an element at the end of a list, or under a key of a map, in the place of the one that is there. The element
// belongs to the library from the call on, whether it succeeds or not; it must not be used any more. Pointers to other
// elements that were handed out before are no longer valid. ZORVANE_OTHER: no list or map, a NULL or a key that is no
// UTF-8, or no memory; an element of NULL is such a failure too, so that calls can be nested.
int zorvane_value_append(zorvane_value* list, zorvane_value* element);
int zorvane_value_set(zorvane_value* map, const char* key, zorvane_value* element);

// 0 for NULL.
int zorvane_value_type(const zorvane_value* value);
// A value of another type, or NULL, gives 0, 0.0 and NULL.
int zorvane_value_get_boolean(const zorvane_value* value);
int64_t zorvane_value_get_integer(const zorvane_value* value);
// Also of a ZORVANE_INTEGER that is not negative.
uint64_t zorvane_value_get_unsigned(const zorvane_value* value);
// The number of a real or a date.
double zorvane_value_get_real(const zorvane_value* value);
const char* zorvane_value_get_string(const zorvane_value* value);
// Not NULL for data of no bytes. size may be NULL.
const void* zorvane_value_get_data(const zorvane_value* value, size_t* size);
// Elements of a list or a map.
size_t zorvane_value_count(const zorvane_value* value);
// NULL behind the end of the list.
const zorvane_value* zorvane_value_at(const zorvane_value* list, size_t index);
// NULL when the map has no such key.
const zorvane_value* zorvane_value_get(const zorvane_value* map, const char* key);
// The key that comes after this one in the order of bytes, the first one for NULL, NULL after the last.
const char* zorvane_value_next_key(const zorvane_value* map, const char* key);

// ---- Requests: one function for each command ----
//
// Each returns NULL only when there is no memory; zorvane_call and zorvane_async_start report that, and arguments that
// are not allowed: a missing string, an empty identifier, text that is no UTF-8, flags that the command does not have.
// A request is used once. The comment of a function begins with the items that the command's result has.

enum {
    // Make the container when there is none.
    ZORVANE_CREATE = 1,
    // One that lasts until it is asked for again, or the next boot.
    ZORVANE_TRANSIENT = 2,
    // The entitlements stand for an identifier that is not installed yet.
    ZORVANE_PLACEHOLDER = 4,
    // The container is of no program of the system's own.
    ZORVANE_THIRD_PARTY = 8,
    // Wait for the unlock of a device that is locked.
    ZORVANE_RETRY_IF_LOCKED = 16
};

// identifier, path, uuid, existed. Finds a container. Flags: ZORVANE_CREATE, ZORVANE_TRANSIENT. Without an identifier
// (NULL) the caller's own is meant. ZORVANE_NOT_FOUND: there is none, and it was not to be made.
zorvane_request* zorvane_request_lookup(uint32_t container_class, uint32_t user, const char* identifier,
                                        uint32_t flags) ZORVANE_MUST_USE;
// Entries with identifier and uuid, in no particular order. Flag: ZORVANE_TRANSIENT.
zorvane_request* zorvane_request_list(uint32_t container_class, uint32_t user, uint32_t flags) ZORVANE_MUST_USE;
// One page of the list, in the order of the identifiers' bytes. after: NULL for the first page, then the text that
// zorvane_result_next_page gave for the page before.
zorvane_request* zorvane_request_list_page(uint32_t container_class, uint32_t user, uint32_t flags,
                                           const char* after) ZORVANE_MUST_USE;
// Takes a container out of the store; its files go when death row is emptied. Flag: ZORVANE_TRANSIENT.
zorvane_request* zorvane_request_delete(uint32_t container_class, uint32_t user, const char* identifier,
                                        uint32_t flags) ZORVANE_MUST_USE;
// The same for several, by their uuids; those that are not there are skipped.
zorvane_request* zorvane_request_stage_for_delete(const zorvane_address* containers, size_t count) ZORVANE_MUST_USE;
// Deletes what is on death row; answered when that is done.
zorvane_request* zorvane_request_empty_death_row(void) ZORVANE_MUST_USE;
// Puts the second container in the place of the first, which goes. Without a first one (NULL) the second, a transient
// one, becomes the live container of its identifier; code 27: that one exists already.
zorvane_request* zorvane_request_replace(const zorvane_address* old, const zorvane_address* fresh) ZORVANE_MUST_USE;
// Empties a data container: path and uuid stay.
zorvane_request* zorvane_request_wipe(uint32_t container_class, uint32_t user, const char* identifier) ZORVANE_MUST_USE;
// The same for a plug-in's data (class 4), by a program whose registry entry names that plug-in.
zorvane_request* zorvane_request_wipe_plugin_data(uint32_t user, const char* identifier) ZORVANE_MUST_USE;

// path, transient, and as value the map of all info values.
zorvane_request* zorvane_request_metadata(const zorvane_address* container) ZORVANE_MUST_USE;
// value. ZORVANE_NOT_FOUND: no such container (code 21) or no such key (code 24).
zorvane_request* zorvane_request_info(const zorvane_address* container, const char* key) ZORVANE_MUST_USE;
// Without a value (NULL) the key is removed. The value is copied.
zorvane_request* zorvane_request_set_info(const zorvane_address* container, const char* key,
                                          const zorvane_value* value) ZORVANE_MUST_USE;
// bytes on the disk.
zorvane_request* zorvane_request_disk_usage(const zorvane_address* container) ZORVANE_MUST_USE;
// Makes the standard subdirectories again.
zorvane_request* zorvane_request_recreate_structure(const zorvane_address* container) ZORVANE_MUST_USE;
// Gives the directory a new name; the uuid stays.
zorvane_request* zorvane_request_regenerate_directory(const zorvane_address* container) ZORVANE_MUST_USE;
// Changes the data-protection class (0, 1 or 3) of a data container. Flags: ZORVANE_THIRD_PARTY,
// ZORVANE_RETRY_IF_LOCKED; with the latter the answer may take as long as the device stays locked. Code 61: the device
// is locked.
zorvane_request* zorvane_request_set_protection(uint32_t container_class, uint32_t user, const char* identifier,
                                                int32_t protection_class, uint32_t flags) ZORVANE_MUST_USE;

// Shared containers. Without an identifier (NULL) the caller's own; each container is made when it is first asked for.
// Entries with identifier and path: the groups of an identifier.
zorvane_request* zorvane_request_group_paths(uint32_t user, const char* identifier) ZORVANE_MUST_USE;
// Entries with identifier.
zorvane_request* zorvane_request_group_identifiers(uint32_t user, const char* identifier) ZORVANE_MUST_USE;
// path. ZORVANE_REFUSED: the identifier is not entitled to one.
zorvane_request* zorvane_request_system_path(const char* identifier) ZORVANE_MUST_USE;
// Entries with identifier and path.
zorvane_request* zorvane_request_system_group_paths(const char* identifier) ZORVANE_MUST_USE;
// path.
zorvane_request* zorvane_request_system_group_path(const char* group, const char* identifier) ZORVANE_MUST_USE;
// Replaces what an identifier is entitled to. Without entitlements (NULL), what is registered is removed, with the
// containers that go with it. With a parent (else NULL), the identifier is its child. Flag: ZORVANE_PLACEHOLDER. The
// map is copied.
zorvane_request* zorvane_request_register(const char* identifier, const zorvane_value* entitlements, const char* parent,
                                          uint32_t flags) ZORVANE_MUST_USE;

// value: whom the daemon takes this program for and why ("Peer"), how it is doing ("Daemon"), and more for the owner of
// the root. For every program.
zorvane_request* zorvane_request_status(void) ZORVANE_MUST_USE;
// For tests of clients: on an internal build, the daemon ends without an answer so often, and then answers.
zorvane_request* zorvane_request_retry_test(uint32_t user, uint64_t crashes) ZORVANE_MUST_USE;

// Only for a request that was handed to neither zorvane_call nor zorvane_async_start.
void zorvane_request_free(zorvane_request* request);

// ---- Calls that wait ----

// The environment's ZORVANE_TIMEOUT_MILLISECONDS, else a minute; for calls that walk a tree of files or wait
// for an unlock, for ever.
#define ZORVANE_TIMEOUT_DEFAULT INT64_C(-1)
#define ZORVANE_TIMEOUT_NEVER INT64_C(0)

// A connection to the daemon of a root (NULL: "/"). The timeout, in milliseconds, is for connecting and for each call.
// NULL: it failed.
zorvane_client* zorvane_connect(const char* root, int64_t timeout_milliseconds, zorvane_error* error) ZORVANE_MUST_USE;
void zorvane_client_free(zorvane_client* client);

// Sends a request and waits for its answer. The request belongs to the library from the call on, whether it succeeds or
// not. *result is NULL after a failure, else the caller's to free; result may be NULL for commands of whose answer
// nothing is wanted. Returns the kind of the error, or ZORVANE_OK. After ZORVANE_UNREACHABLE, ZORVANE_TIMED_OUT and a
// refusal without a code, the next call connects anew.
int zorvane_call(zorvane_client* client, zorvane_request* request, zorvane_result** result, zorvane_error* error);

// ---- Results ----

void zorvane_result_free(zorvane_result* result);
// An item that the command's answer does not have is NULL or 0, and so is each of NULL.
const char* zorvane_result_path(const zorvane_result* result);
const char* zorvane_result_identifier(const zorvane_result* result);
// 16 bytes.
const uint8_t* zorvane_result_uuid(const zorvane_result* result);
// The container was there before the call.
int zorvane_result_existed(const zorvane_result* result);
int zorvane_result_transient(const zorvane_result* result);
uint64_t zorvane_result_bytes(const zorvane_result* result);
const zorvane_value* zorvane_result_value(const zorvane_result* result);
// The entries of a list.
size_t zorvane_result_count(const zorvane_result* result);
const char* zorvane_result_identifier_at(const zorvane_result* result, size_t index);
const char* zorvane_result_path_at(const zorvane_result* result, size_t index);
const uint8_t* zorvane_result_uuid_at(const zorvane_result* result, size_t index);
// For the next zorvane_request_list_page; NULL after the last page.
const char* zorvane_result_next_page(const zorvane_result* result);

// ---- Calls that do not wait, for any event loop ----
//
// An async object has one thread of its own, in which signals are blocked and no code of the caller's runs. It connects
// when the first call is started, and carries calls out one after the other, in the order in which they were started:
// two that are to be under way at once need two objects. Its owner watches zorvane_async_fd and calls
// zorvane_async_dispatch when it is readable.

// Called by zorvane_async_dispatch, in its thread. One of result, which is then the callback's to free, and error,
// which is gone when the callback returns, is NULL. It may start and cancel calls, not free the async object, nor
// throw.
typedef void (*zorvane_callback)(void* data, zorvane_result* result, const zorvane_error* error);

// As zorvane_connect, but nothing waits: that there is no daemon is an error of the calls.
zorvane_async* zorvane_async_new(const char* root, int64_t timeout_milliseconds, zorvane_error* error) ZORVANE_MUST_USE;
// Calls that are waiting or under way are given up, their callbacks are not called. Takes a second at most.
void zorvane_async_free(zorvane_async* async);
// Readable (POLLIN) while answers wait for zorvane_async_dispatch. The object's: only to be watched.
int zorvane_async_fd(const zorvane_async* async);
// Starts a call; callback may be NULL. Returns its number, or 0: it failed, and callback will not be called. The
// request belongs to the library from the call on, whether it succeeds or not.
uint64_t zorvane_async_start(zorvane_async* async, zorvane_request* request, zorvane_callback callback, void* data,
                             zorvane_error* error);
// Calls the callbacks of the answers that are there. Returns how many.
size_t zorvane_async_dispatch(zorvane_async* async);
// The callback of this call will not be called: returns 1; 0 when it was called already. One that is under way is given
// up, and may still be carried out.
int zorvane_async_cancel(zorvane_async* async, uint64_t call);

#ifdef __cplusplus
}
#endif
