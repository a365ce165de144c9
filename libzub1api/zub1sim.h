// Control of the simulated collection library, for tests and tools; the
// collector never calls these.
//
// The simulator behind zub/zub1api.h replays table scripts (JSON Lines) and
// HAR captures (see libzub1api/README.md) to the filters that the registered
// applications define. These calls reset it, read its counters, wait until
// it has nothing left to do and feed it single tables.
#ifndef WQ5_LIBZUB1API_ZUB1SIM_H
#define WQ5_LIBZUB1API_ZUB1SIM_H

#include <stdint.h>

#include "zub/zub1api.h"

#ifdef __cplusplus
extern "C" {
#endif

// Status codes of the ZUB1_* calls other than 0.
#define ZUB1SIM_RC_BAD_ARGUMENT  1  // a null id, request or name pointer
#define ZUB1SIM_RC_UNKNOWN_APPL  2  // the id names no registered application
#define ZUB1SIM_RC_BAD_REQUEST   3  // a filter request that breaks the layout
#define ZUB1SIM_RC_UNKNOWN_FILTER 5 // a removal naming no filter of the application
#define ZUB1SIM_RC_NOT_DELIVERED 6  // a freed pointer that is no table held by the caller
#define ZUB1SIM_RC_BUSY          7  // reset in progress, or the process is ending
#define ZUB1SIM_RC_REFUSED       8  // registration refused (ZUB1_REGISTER_FAILURES)
#define ZUB1SIM_RC_INTERNAL      9  // out of memory or threads

// Counters since the process started or the last ZUB1SIM_Reset.
typedef struct ZUB1SIM_STATS {
    uint64_t tables;           // valid tables queued (script lines and ZUB1SIM_DeliverLine)
    uint64_t delivered;        // tables handed to a callback
    uint64_t freed;            // delivered tables given back
    uint64_t unmatched;        // tables dropped because no filter matched
    uint64_t invalid;          // script lines and ZUB1SIM_DeliverLine calls rejected
    uint64_t badFrees;         // ZUB1_FreeResponseTimeResult calls with a pointer not held
    uint64_t registrations;    // successful ZUB1_RegisterApplication calls
    uint64_t refusals;         // refused ZUB1_RegisterApplication calls
    uint64_t unregistrations;  // applications ended
    uint64_t defineRequests;   // accepted filter definitions
    uint64_t filtersDefined;   // filters defined now, over all applications
    uint64_t entries;          // entries of replayed HAR captures, every pass counted
    uint64_t skipped;          // of those, the ones that yielded no table entry
} ZUB1SIM_STATS;

// One filter as defined now.
typedef struct ZUB1SIM_FILTER {
    ZUB_APPL_ID applId;
    uint32_t filterId;  // non-zero, unique within the process
    uint16_t protocol;
    uint16_t service;
    ZUB_CALLBACK callback;
} ZUB1SIM_FILTER;

// Returns the simulator to its state at process start: stops and joins its
// threads, drops queued tables, filters and counters; the settings are read
// again at the next registration. Tables still held by the caller stay valid
// and may be given back later (not counted). Returns 0, or -1 (with a
// message on stderr) while an application is registered or when called on
// one of the library's own threads.
int ZUB1SIM_Reset(void);

// Copies the counters to *stats.
void ZUB1SIM_GetStats(ZUB1SIM_STATS* stats);

// Waits until the library has started (first registration), read the whole
// script, handed out or dropped every queued table, every delivered table
// has been given back, every callback has returned and, with
// ZUB1_STATUS_FILE set, the status file shows that state. Returns 0 then, or -1 when `timeoutMs` passed first. A negative
// `timeoutMs` waits without limit.
int ZUB1SIM_WaitIdle(int timeoutMs);

// Parses one table line (the script format) and queues the table behind the
// ones already queued. Returns 0, or -1 when the line is invalid (reported on
// stderr as "ZUB1SIM_DeliverLine:<call number>: ..." and counted).
int ZUB1SIM_DeliverLine(const char* jsonLine);

// While `hold` is non-zero no table is handed out: tables stay queued, in
// order, until a call with 0. Lets a test register and define its filters
// before the first table can arrive, whatever the start delay. Cleared by
// ZUB1SIM_Reset.
void ZUB1SIM_HoldDelivery(int hold);

// Copies up to `capacity` of the filters defined now, in definition order,
// to `filters` and returns how many there are (possibly more than
// `capacity`).
int ZUB1SIM_GetFilters(ZUB1SIM_FILTER* filters, int capacity);

#ifdef __cplusplus
}
#endif

#endif
