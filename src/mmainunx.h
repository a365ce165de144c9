// Process shell of the collector: entry point, SIGTERM handling and the
// control thread that keeps the collector registered.
#ifndef WQ5_MMAINUNX_H
#define WQ5_MMAINUNX_H

// Installs pvoquit for SIGTERM; exits with status -1 when it cannot.
void catch_signal();
// The SIGTERM handler: sets the quit flag and wakes the control loop.
void pvoquit(int);
// Start routine of the control thread: builds the filter manager, registers
// whenever the registration is gone, and returns once quit is set.
void* control_loop(void* arg);

#endif
