// Run-time control of libmoq beyond the platform interface: for tests and
// tools, never used by the collector itself.
#ifndef WQ5_LIBMOQ_MOQ_CONTROL_H
#define WQ5_LIBMOQ_MOQ_CONTROL_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

// Replaces the class mask of every function block. Blocks pick the new mask
// up at their next trc1Mask() call.
void MOQ_SetMask(int mask);

// The class mask currently in force.
int MOQ_GetMask(void);

// Receives every finished trace line (with its newline) instead of the trace
// file. May be called on any thread, also concurrently. A null sink restores
// the trace file. Calls of the sink are serialised; once MOQ_SetSink returns,
// the previous sink is neither running nor called again. A sink must not
// trace or call MOQ_SetSink itself.
typedef void (*MOQ_Sink)(void* context, const char* line, size_t length);
void MOQ_SetSink(MOQ_Sink sink, void* context);

#ifdef __cplusplus
}
#endif

#endif
