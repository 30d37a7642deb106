// Process-wide state of the daemon. Written on the main thread only, except
// the running flag, which the SIGTERM handler clears.
#ifndef TARN_GLOBALS_H
#define TARN_GLOBALS_H

#include <csignal>

extern volatile sig_atomic_t g_running;  // 1 while the loop turns
extern int g_localSelected;              // 1: local player selected
extern int g_selectedRenderer;           // renderer index, -1 for none
extern int g_changed;                    // published at 4628

#endif
