// Calls of the response-time collection library (libzub1api.so).
//
// The collector registers as an application, defines one filter per traffic
// kind and receives response-time data tables (zub/zub1rt.h) through the
// filter's callback, on the library's own threads. Every delivered table is
// handed back exactly once with ZUB1_FreeResponseTimeResult.
#ifndef WQ5_ZUB_ZUB1API_H
#define WQ5_ZUB_ZUB1API_H

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

// Application id; 0 means "not registered". Every call names the
// application by the address of such an id.
typedef uint32_t ZUB_APPL_ID;

// Callback of a filter: `table` is a ZUB_RESPONSE_TIME_DATA_TABLE*, owned by
// the library until it is handed back.
typedef void (*ZUB_CALLBACK)(void* table);

#define ZUB_REQ_DEFINE_FILTER 0u
#define ZUB_REQ_REMOVE_FILTER 2u
#define ZUB_REQ_LEVEL         3u
#define ZUB_REQ_FLAG_CALLBACK 0x4000u

// Filter request, native byte order, zero-filled before use. On a 32-bit
// build it is 72 bytes with the callback at offset 68. A 64-bit function
// pointer does not fit there: on a 64-bit build bytes 68 to 71 stay zero and
// the callback is an 8-byte pointer at offset 72 (80 bytes in all).
typedef struct ZUB_FILTER_REQUEST {
    uint32_t requestType;  // ZUB_REQ_DEFINE_FILTER or ZUB_REQ_REMOVE_FILTER
    uint32_t filterId;     // remove: the filter; define: 0
    uint16_t level;        // ZUB_REQ_LEVEL
    uint16_t flags;        // define: ZUB_REQ_FLAG_CALLBACK; remove: 0
    uint16_t service;      // port number, or 0
    uint16_t protocol;     // protocol number
    uint8_t reserved[52];  // offsets 16 to 67, zero
#if UINTPTR_MAX > 0xffffffffu
    uint32_t reserved64;   // offsets 68 to 71 on a 64-bit build, zero
#endif
    ZUB_CALLBACK callback; // define: the callback; remove: null
} ZUB_FILTER_REQUEST;

#if UINTPTR_MAX > 0xffffffffu
#define ZUB_FILTER_REQUEST_SIZE 80
#define ZUB_FILTER_CALLBACK_OFFSET 72
#else
#define ZUB_FILTER_REQUEST_SIZE 72
#define ZUB_FILTER_CALLBACK_OFFSET 68
#endif

#ifdef __cplusplus
static_assert(sizeof(ZUB_FILTER_REQUEST) == ZUB_FILTER_REQUEST_SIZE, "filter request size");
static_assert(offsetof(ZUB_FILTER_REQUEST, filterId) == 4, "filterId offset");
static_assert(offsetof(ZUB_FILTER_REQUEST, level) == 8, "level offset");
static_assert(offsetof(ZUB_FILTER_REQUEST, flags) == 10, "flags offset");
static_assert(offsetof(ZUB_FILTER_REQUEST, service) == 12, "service offset");
static_assert(offsetof(ZUB_FILTER_REQUEST, protocol) == 14, "protocol offset");
static_assert(offsetof(ZUB_FILTER_REQUEST, reserved) == 16, "reserved offset");
static_assert(offsetof(ZUB_FILTER_REQUEST, callback) == ZUB_FILTER_CALLBACK_OFFSET, "callback offset");
#endif

// Registers an application named `name`. Returns 0 on success, having
// written a non-zero id to *id; on failure *id is left unchanged.
int ZUB1_RegisterApplication(ZUB_APPL_ID* id, const char* name, int reserved1, int reserved2);

// Defines or removes a filter of the application *id. Returns 0 on success.
int ZUB1_DefineFilter(ZUB_APPL_ID* id, ZUB_FILTER_REQUEST* request);

// Hands a delivered table back to the library.
int ZUB1_FreeResponseTimeResult(void* table);

// Ends the application *id. On return no callback of it is running on
// another thread and none will arrive; called from inside one of its own
// callbacks it waits for the others only.
int ZUB1_UnregisterApplication(ZUB_APPL_ID* id);

#ifdef __cplusplus
}
#endif

#endif
