// SIGTERM at a spread of moments of start-up: to the launching process while
// no pid file exists yet, else to the daemon the pid file names.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <set>
#include <string>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

// Whatever the moment, every process ends, none with an error status, the
// daemon never dies of the signal itself, leaves neither pid file nor socket,
// logs its exit at most once, and the next start works.
TEST(StartupFaults, SigtermAtManyPointsOfStartUp)
{
    ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
    tarntest::Harness h;
    for (int delay : {0, 200, 1000, 3000, 6000, 10000, 20000, 40000, 80000, 150000, 300000}) {
        SCOPED_TRACE("delay " + std::to_string(delay) + " us");
        h.ClearLog();
        std::set<pid_t> before;
        for (const auto &r : h.Reaped())
            before.insert(r.first);
        pid_t launcher = h.Spawn({tarntest::BinPath("tarnaudiod")});
        ASSERT_GT(launcher, 0);
        usleep(delay);
        int pid = h.PidFromFile();
        std::set<int> signalled = {(pid > 0 && pid != launcher) ? pid : launcher};
        kill(*signalled.begin(), SIGTERM);
        // A daemon whose pid file shows up later gets its SIGTERM then.
        bool ended = false;
        for (int i = 0; i < 300 && !ended; ++i) {
            h.Reap();
            int p = h.PidFromFile();
            if (p > 0 && signalled.insert(p).second && kill(p, 0) == 0)
                kill(p, SIGTERM);
            ended = h.WaitAllChildren(50) == 0;
        }
        ASSERT_TRUE(ended) << "a process did not end after SIGTERM";
        for (const auto &r : h.Reaped()) {
            if (before.count(r.first))
                continue;
            // Only the launcher may die of the signal (before it has a handler).
            bool ok = (WIFEXITED(r.second) && WEXITSTATUS(r.second) == 0) ||
                      (r.first == launcher && WIFSIGNALED(r.second) && WTERMSIG(r.second) == SIGTERM);
            EXPECT_TRUE(ok) << "pid " << r.first << " status " << r.second;
        }
        EXPECT_LE(h.CountLog("tarnaudiod exit"), 1);
        EXPECT_FALSE(h.Exists(TARN_PID_FILE));
        EXPECT_FALSE(h.Exists(TARN_CTRL_SOCKET));
        if (::testing::Test::HasFailure()) {
            fprintf(stderr, "--- daemon log ---\n%s\n", h.Log().c_str());
            break;
        }
    }
    ASSERT_EQ(0, h.Start()) << h.Error();
    EXPECT_EQ(0, h.Request(ACT_GET_STATUS));
    EXPECT_EQ(0, h.Stop());
}

}  // namespace
