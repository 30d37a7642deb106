// Milliseconds on the monotonic clock, for deadlines and intervals.
#ifndef TARN_CLOCK_H
#define TARN_CLOCK_H

#include <cstdint>
#include <ctime>

inline int64_t TarnNowMs()
{
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<int64_t>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

#endif
