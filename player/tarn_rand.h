// The daemon's own random sequence for the queue shuffle.
//
// The shuffle order must replay identically at every start of the daemon:
// it follows the C library's rand() sequence from its default (unseeded)
// state. rand() itself cannot be used: libupnp's worker threads reseed it,
// and its state is shared by all threads. This generator keeps a private
// copy of the same algorithm (seed 1, the 128-byte additive feedback state)
// and so yields exactly the values an unseeded rand() would.
#ifndef TARN_RAND_H
#define TARN_RAND_H

#include <cstdlib>

class TarnRandGen {
public:
    TarnRandGen();
    // Restarts the sequence from its first value.
    void Reset();
    // The next value, 0 to RAND_MAX, as rand() would return it.
    int Next();

private:
    struct random_data data;
    char state[128];
};

// The process-wide sequence used by the play queues (main thread only).
int TarnRand();
// Restarts the process-wide sequence (as at daemon start).
void TarnRandReset();

#endif
