// Trace and environment services of the platform base library (libmoq.so).
//
// Every traced source file owns one static unit block (TRC1_CUB) and every
// traced function one static function block (TRC1_EPB). A function reads its
// class mask once per call with trc1Mask() and tests one class bit per
// message; a message is formatted only when its bit is set.
//
// The blocks are shared by all threads. Their cache fields are read and
// written with atomic builtins so that concurrent use is free of data races;
// keep them plain integers so that the blocks stay constant-initialised
// statics with no start-up order.
#ifndef WQ5_PLATFORM_MOQ_H
#define WQ5_PLATFORM_MOQ_H

#ifdef __cplusplus
extern "C" {
#endif

// Class bits of a trace mask.
#define TRC_DETAIL 0x01
#define TRC_INFO   0x10
#define TRC_FLOW   0x40
#define TRC_ERROR  0x80

// Event kinds of TRC1_Event.
#define TRC1_ENTRY      0  // function entry
#define TRC1_EXIT_VALUE 1  // exit; the int return value follows as 4th argument
#define TRC1_EXIT       2  // exit without a value

// Unit block: one per source file.
typedef struct TRC1_CUB {
    const char* unitName;     // source file, e.g. "mcfg"
    const char* compileDate;  // __DATE__
    const char* compileTime;  // __TIME__
    unsigned int generation;  // per-unit generation word; starts at 1
} TRC1_CUB;

// Function block: one per traced function.
typedef struct TRC1_EPB {
    TRC1_CUB* unit;
    const char* funcName;
    int funcNameLen;
    int line;                          // where the function's tracing starts
    unsigned int* generation;          // current generation (set by TRC1_Sync)
    int cachedMask;                    // mask cached by TRC1_Sync
    unsigned int cachedGeneration;     // generation the mask was cached at; 0 = never
} TRC1_EPB;

#define TRC1_UNIT_INIT(name) { (name), __DATE__, __TIME__, 1u }
#define TRC1_BLOCK_INIT(unitBlock, fname) \
    { &(unitBlock), (fname), (int)sizeof(fname) - 1, __LINE__, &(unitBlock).generation, 0, 0u }

// Returns the function's current class mask and refreshes the block's cache.
int TRC1_Sync(TRC1_EPB* block);

// Records an entry (TRC1_ENTRY) or exit event (TRC1_EXIT_VALUE with an int
// value as 4th argument, TRC1_EXIT without). `line` is the source line.
void TRC1_Event(TRC1_EPB* block, int line, int kind, ...);

// Records one printf-style message; `line` is the source line of the call.
void TRC1_Printf(TRC1_EPB* block, int line, const char* format, ...)
#if defined(__GNUC__)
    __attribute__((format(printf, 3, 4)))
#endif
    ;

// The value of environment variable `name`, or `dflt` when it is not set or
// set to the empty string. `dflt` may be null; null then means unset.
const char* QEN1_GetEnv(const char* name, const char* dflt);

// The class mask for one call of a traced function: the cached mask while
// the block's generation is current, else a fresh one from TRC1_Sync.
static inline int trc1Mask(TRC1_EPB* block)
{
    unsigned int* gen = __atomic_load_n(&block->generation, __ATOMIC_ACQUIRE);
    unsigned int current = __atomic_load_n(gen, __ATOMIC_ACQUIRE);
    if (__atomic_load_n(&block->cachedGeneration, __ATOMIC_ACQUIRE) == current)
        return __atomic_load_n(&block->cachedMask, __ATOMIC_RELAXED);
    return TRC1_Sync(block);
}

#ifdef __cplusplus
}
#endif

#endif
