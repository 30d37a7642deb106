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
    std::vector<int> v(kCount);
    for (int &x : v)
        x = rand();
    return v;
}();

TEST(TarnRand, MatchesTheUnseededCLibrarySequenceWhateverOthersSeed)
{
    TarnRandGen gen, other;
    std::vector<int> got(kCount);
    for (int &x : got)
        x = gen.Next();
    EXPECT_EQ(kUnseeded, got);
    EXPECT_EQ(kUnseeded[0], other.Next()) << "generators are independent";
    gen.Reset();
    EXPECT_EQ(kUnseeded[0], gen.Next());

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
}

}  // namespace
