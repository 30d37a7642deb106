#include "player/tarn_rand.h"

#include <cstring>

TarnRandGen::TarnRandGen()
{
    Reset();
}

void TarnRandGen::Reset()
{
    // initstate_r reads the previous state type from data; start from zero.
    memset(&data, 0, sizeof(data));
    memset(state, 0, sizeof(state));
    initstate_r(1, state, sizeof(state), &data);
}

int TarnRandGen::Next()
{
    int32_t value = 0;
    random_r(&data, &value);
    return static_cast<int>(value);
}

namespace {

TarnRandGen &Shared()
{
    static TarnRandGen gen;
    return gen;
}

}  // namespace

int TarnRand()
{
    return Shared().Next();
}

void TarnRandReset()
{
    Shared().Reset();
}
