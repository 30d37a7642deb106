// Attaching the status segments (System V shared memory): the one place
// that gets and attaches them, for the daemon, mplayer-daemon, the tools,
// the tests and the benchmarks.
#ifndef TARN_SHM_ATTACH_H
#define TARN_SHM_ATTACH_H

#include <cstddef>

// Flags of TarnShmAttach.
#define TARN_SHM_CREATE 1    // create the segment (mode 0666) when it is not there
#define TARN_SHM_READONLY 2  // attach for reading only

// The step at which TarnShmAttach failed.
enum TarnShmStep {
    TARN_SHM_STEP_NONE = 0,
    TARN_SHM_STEP_GET,     // no such segment, too small, or not created
    TARN_SHM_STEP_ATTACH,  // there, but not attached (permissions, limits)
};

// Gets the segment `key` of `size` bytes and attaches it. The key is
// TarnShmKeyPlayer() or TarnShmKeyPublished() (tarn_env.h: TARN_SHM_KEY or
// the appliance's default), or another daemon's. Returns the address, or
// null with errno set by the step that failed, which *failed (when given)
// names. Logs nothing: callers tell in their own words.
void *TarnShmAttach(int key, size_t size, int flags, TarnShmStep *failed = nullptr);

#endif
