// tarnaudiod as a process: start-up, single instance, pid files, signals,
// shutdown and what it leaves in the status segments.
#include <gtest/gtest.h>

#include <csignal>
#include <cstring>
#include <string>
#include <sys/socket.h>
#include <unistd.h>

#include "daemon/tarn_types.h"
#include "platform/tlibc_proc.h"
#include "tests/harness/harness.h"

namespace {

const char kExit[] = "tarnaudiod:530 tarnaudiod exit";

class LifecycleTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    void SetUp() override { ASSERT_TRUE(tarntest::InPrivateNetns()); }
};

TEST_F(LifecycleTest, StartsServesAndStopsCleanly)
{
    ASSERT_EQ(0, h.Start()) << h.Error();
    pid_t pid = h.Pid();
    EXPECT_EQ(pid, h.PidFromFile());
    EXPECT_TRUE(h.Exists(TARN_CTRL_SOCKET));
    EXPECT_TRUE(h.Exists(TARN_MPLAYER_SOCKET));
    ASSERT_NE(nullptr, h.PublishedSegment());
    ASSERT_NE(nullptr, h.PlayerSegment());

    std::string reply;
    ASSERT_EQ(0, h.Request(ACT_SET_CHANGED, nullptr, &reply)) << h.Error();
    EXPECT_EQ("null\n", reply);

    EXPECT_EQ(0, h.Stop());
    EXPECT_FALSE(TLIBCProcAlive(pid));
    EXPECT_FALSE(h.Exists(TARN_PID_FILE));
    EXPECT_FALSE(h.Exists(TARN_CTRL_SOCKET));
    // The mplayer socket file stays; the next start replaces it.
    EXPECT_TRUE(h.Exists(TARN_MPLAYER_SOCKET));
    EXPECT_EQ(1, h.CountLog(kExit)) << h.Log();

    // And the next start works with the leftovers.
    ASSERT_EQ(0, h.Start()) << h.Error();
    EXPECT_EQ(0, h.Request(ACT_GET_STATUS, nullptr, &reply));
    EXPECT_EQ(0, h.Stop());
    EXPECT_EQ(2, h.CountLog(kExit));
}

TEST_F(LifecycleTest, SecondInstanceLeavesTheFirstAlone)
{
    ASSERT_EQ(0, h.Start()) << h.Error();
    pid_t pid = h.Pid();
    std::string out;
    EXPECT_EQ(0, h.Launch(&out));
    EXPECT_EQ("Audio daemon already exists. Pid[" + std::to_string(pid) + "]\n", out);
    EXPECT_EQ(1, h.CountLog("tarnaudiod:67 Audio daemon already exists. Pid[" +
                            std::to_string(pid) + "]"));
    EXPECT_EQ(0, h.CountLog(kExit));
    EXPECT_EQ(pid, h.PidFromFile());
    EXPECT_TRUE(h.Exists(TARN_CTRL_SOCKET));
    EXPECT_EQ(0, h.Request(ACT_GET_STATUS));
    EXPECT_EQ(0, h.Stop());
}

TEST_F(LifecycleTest, StalePidFileIsOverwritten)
{
    // A pid that surely names no process any more: a child that has ended.
    pid_t dead = h.Spawn({"/bin/true"});
    ASSERT_GT(dead, 0);
    ASSERT_EQ(0, h.WaitExit(dead, 5000));
    ASSERT_EQ(0, h.WriteFile(TARN_PID_FILE, std::to_string(dead) + "\n"));
    ASSERT_EQ(0, h.Start()) << h.Error();
    EXPECT_NE(dead, h.PidFromFile());
    EXPECT_EQ(h.Pid(), h.PidFromFile());
    EXPECT_EQ(0, h.CountLog("already exists"));
    EXPECT_EQ(0, h.Stop());
}

TEST_F(LifecycleTest, PidFileOfAZombieCountsAsStale)
{
    // A child that has ended but is not reaped yet: still in the process
    // table, yet no running daemon.
    pid_t zombie = h.Spawn({"/bin/true"});
    ASSERT_GT(zombie, 0);
    usleep(200000);
    EXPECT_FALSE(TLIBCProcAlive(zombie));
    ASSERT_EQ(0, h.WriteFile(TARN_PID_FILE, std::to_string(zombie) + "\n"));
    ASSERT_EQ(0, h.Start()) << h.Error();
    EXPECT_EQ(0, h.CountLog("already exists"));
    EXPECT_EQ(0, h.Stop());
}

TEST_F(LifecycleTest, SigtermDuringStartUpEndsInOrderlyShutdown)
{
    pid_t launcher = h.Spawn({tarntest::BinPath("tarnaudiod")});
    ASSERT_GT(launcher, 0);
    // Signal the daemon the moment its pid file names it.
    int pid = 0;
    for (int i = 0; i < 100000 && pid <= 0; ++i) {
        int p = h.PidFromFile();
        if (p > 0 && p != launcher)
            pid = p;
    }
    ASSERT_GT(pid, 0);
    ASSERT_EQ(0, kill(pid, SIGTERM));
    EXPECT_EQ(0, h.WaitExit(pid, 15000));
    EXPECT_EQ(0, h.WaitExit(launcher, 5000));
    EXPECT_EQ(1, h.CountLog(kExit)) << h.Log();
    EXPECT_FALSE(h.Exists(TARN_PID_FILE));
    EXPECT_FALSE(h.Exists(TARN_CTRL_SOCKET));
}

TEST_F(LifecycleTest, SigtermWhileARequestIsInFlightStillAnswersIt)
{
    ASSERT_EQ(0, h.Start()) << h.Error();
    pid_t pid = h.Pid();
    int fd = h.Connect();
    ASSERT_GE(fd, 0);
    // The daemon accepts and waits for the request; the signal lands in
    // that wait.
    usleep(100000);
    ASSERT_EQ(0, kill(pid, SIGTERM));
    usleep(100000);
    ControlRequest req = tarntest::MakeRequest(ACT_GET_STATUS);
    ASSERT_EQ(static_cast<ssize_t>(sizeof(req)), write(fd, &req, sizeof(req)));
    char reply[CTRL_REPLY_SIZE];
    size_t got = 0;
    for (;;) {
        ssize_t n = read(fd, reply + got, sizeof(reply) - got);
        if (n <= 0)
            break;
        got += static_cast<size_t>(n);
    }
    close(fd);
    EXPECT_EQ(sizeof(reply), got);
    EXPECT_NE(nullptr, strstr(reply, "\"PlayerState\""));
    EXPECT_EQ(0, h.WaitExit(pid, 15000));
    EXPECT_EQ(1, h.CountLog(kExit));
}

TEST_F(LifecycleTest, ShutdownZeroesTheSegmentsAsSpecifiedAndRestartReattaches)
{
    ASSERT_EQ(0, h.Start()) << h.Error();
    PlayerStatusShm *player = h.PlayerSegmentWritable();
    ASSERT_NE(nullptr, player);
    // mplayer-daemon's part of the segment, as it might look. With no
    // mplayer-daemon connected the daemon does not read it.
    memset(player, 0xab, sizeof(*player));
    EXPECT_EQ(0, h.Request(ACT_SET_CHANGED));
    EXPECT_EQ(0, h.Stop());

    const unsigned char *raw = reinterpret_cast<const unsigned char *>(player);
    size_t keptBad = 0, zeroBad = 0;
    for (size_t i = 0; i < 4104; ++i)
        keptBad += raw[i] != 0xab;
    for (size_t i = 4104; i < TARN_SHM_PLAYER_SIZE; ++i)
        zeroBad += raw[i] != 0;
    EXPECT_EQ(0u, keptBad);
    EXPECT_EQ(0u, zeroBad);
    const PublishedStatusShm *pub = h.PublishedSegment();
    ASSERT_NE(nullptr, pub);
    const unsigned char *praw = reinterpret_cast<const unsigned char *>(pub);
    size_t pubBad = 0;
    for (size_t i = 0; i < TARN_SHM_PUBLISHED_SIZE; ++i)
        pubBad += praw[i] != 0;
    EXPECT_EQ(0u, pubBad);

    // The segments outlive the daemon; a new start attaches to them without
    // clearing them.
    memset(player, 0xcd, sizeof(*player));
    ASSERT_EQ(0, h.Start()) << h.Error();
    EXPECT_EQ(0, h.Request(ACT_GET_STATUS));
    size_t changed = 0;
    for (size_t i = 0; i < TARN_SHM_PLAYER_SIZE; ++i)
        changed += raw[i] != 0xcd;
    EXPECT_EQ(0u, changed);
    EXPECT_EQ(0, h.Stop());
}

TEST_F(LifecycleTest, TooSmallExistingSegmentStopsTheStart)
{
    for (int which = 0; which < 2; ++which) {
        SCOPED_TRACE(which);
        h.RemoveSegments();
        h.ClearLog();
        int key = which == 0 ? h.PlayerKey() : h.PublishedKey();
        ASSERT_EQ(0, tarntest::Harness::CreateSegment(key, 64));
        std::string out;
        EXPECT_EQ(0, h.Launch(&out));
        EXPECT_EQ(0, h.WaitAllChildren(15000));
        for (const auto &r : h.Reaped())
            EXPECT_TRUE(WIFEXITED(r.second) && WEXITSTATUS(r.second) == 0) << r.first;
        EXPECT_TRUE(h.WaitLog(kExit));
        EXPECT_EQ(1, h.CountLog(kExit));
        EXPECT_EQ(1, h.CountLog(std::string("tarnaudiod:") + (which == 0 ? "483" : "490") +
                                " Failed to create shared memory. ("))
            << h.Log();
        EXPECT_EQ(1, h.CountLog("shm:35 Failed to create shared memory. key[" + std::to_string(key) +
                                "], size["));
        EXPECT_FALSE(h.Exists(TARN_PID_FILE));
        EXPECT_FALSE(h.Exists(TARN_CTRL_SOCKET));
    }
}

}  // namespace
