// The shuffle's random sequence: identical to an unseeded rand(), and immune
// to other threads reseeding the C library.
#include <gtest/gtest.h>

#include <cstdlib>
#include <thread>
#include <vector>

#include "player/tarn_rand.h"

namespace {

const int kCount = 100000;

// Taken before main, while nothing in this process has seeded rand().
const std::vector<int> kUnseeded = [] {
    std::vector<int> v;
    v.reserve(kCount);
    for (int i = 0; i < kCount; ++i)
        v.push_back(rand());
    return v;
}();

std::vector<int> Take(TarnRandGen &gen, int n)
{
    std::vector<int> v;
    v.reserve(n);
    for (int i = 0; i < n; ++i)
        v.push_back(gen.Next());
    return v;
}

TEST(TarnRand, MatchesTheUnseededCLibrarySequence)
{
    TarnRandGen gen;
    EXPECT_EQ(kUnseeded, Take(gen, kCount));
    // The sequence is not degenerate.
    EXPECT_NE(kUnseeded[0], kUnseeded[1]);
}

TEST(TarnRand, ResetReplaysAndGeneratorsAreIndependent)
{
    TarnRandGen a;
    TarnRandGen b;
    std::vector<int> first = Take(a, 50);
    EXPECT_EQ(std::vector<int>(kUnseeded.begin(), kUnseeded.begin() + 50), first);
    EXPECT_EQ(first, Take(b, 50));
    a.Reset();
    EXPECT_EQ(first, Take(a, 50));
}

TEST(TarnRand, OtherThreadsSeedingTheCLibraryChangeNothing)
{
    TarnRandReset();
    std::vector<int> mine;
    for (int i = 0; i < 10; ++i)
        mine.push_back(TarnRand());
    // What a libupnp worker does: seed and draw from the shared C generator.
    std::thread worker([] {
        srand(12345);
        for (int i = 0; i < 1000; ++i)
            (void)rand();
    });
    worker.join();
    srand(777);
    for (int i = 0; i < 10; ++i)
        mine.push_back(TarnRand());
    EXPECT_EQ(std::vector<int>(kUnseeded.begin(), kUnseeded.begin() + 20), mine);
    TarnRandReset();
    EXPECT_EQ(kUnseeded[0], TarnRand());
}

}  // namespace
