// tarnaudiod as a process: start-up, single instance, pid files, signals,
// shutdown and what it leaves in the status segments.
#include <gtest/gtest.h>

#include <csignal>
#include <cstring>
#include <string>
#include <sys/wait.h>
#include <unistd.h>

#include "daemon/tarn_types.h"
#include "platform/tlibc_proc.h"
#include "tests/harness/harness.h"

namespace {

const char kExit[] = "tarnaudiod:530 tarnaudiod exit";

// Bytes of [from, to) that differ from value.
size_t Differ(const void *seg, size_t from, size_t to, unsigned char value)
{
    size_t n = 0;
    for (size_t i = from; i < to; ++i)
        n += static_cast<const unsigned char *>(seg)[i] != value;
    return n;
}

class LifecycleTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    void SetUp() override { ASSERT_TRUE(tarntest::InPrivateNetns()); }
};

TEST_F(LifecycleTest, StartSecondInstanceStopAndRestart)
{
    ASSERT_EQ(0, h.Start()) << h.Error();
    pid_t pid = h.Pid();
    EXPECT_EQ(pid, h.PidFromFile());
    EXPECT_TRUE(h.Exists(TARN_MPLAYER_SOCKET));
    std::string out;
    EXPECT_EQ(0, h.Launch(&out));
    EXPECT_EQ("Audio daemon already exists. Pid[" + std::to_string(pid) + "]\n", out);
    EXPECT_EQ(1, h.CountLog("tarnaudiod:67 Audio daemon already exists. Pid[" + std::to_string(pid) + "]"));
    EXPECT_EQ(pid, h.PidFromFile());
    std::string reply;
    ASSERT_EQ(0, h.Request(ACT_SET_CHANGED, nullptr, &reply)) << h.Error();
    EXPECT_EQ("null\n", reply);

    EXPECT_EQ(0, h.Stop());
    EXPECT_FALSE(TLIBCProcAlive(pid));
    EXPECT_FALSE(h.Exists(TARN_PID_FILE));
    EXPECT_FALSE(h.Exists(TARN_CTRL_SOCKET));
    EXPECT_EQ(1, h.CountLog(kExit)) << h.Log();
    // The next start works with what was left (the mplayer socket file).
    ASSERT_EQ(0, h.Start()) << h.Error();
    EXPECT_EQ(0, h.Stop());
    EXPECT_EQ(2, h.CountLog(kExit));
}

TEST_F(LifecycleTest, StalePidFilesOfEndedAndZombieProcesses)
{
    for (bool reap : {true, false}) {
        SCOPED_TRACE(reap ? "ended" : "zombie");
        h.ClearLog();
        pid_t dead = h.Spawn({"/bin/true"});
        ASSERT_GT(dead, 0);
        if (reap)
            ASSERT_EQ(0, h.WaitExit(dead, 5000));
        else
            usleep(200000);
        ASSERT_EQ(0, h.WriteFile(TARN_PID_FILE, std::to_string(dead) + "\n"));
        ASSERT_EQ(0, h.Start()) << h.Error();
        EXPECT_EQ(h.Pid(), h.PidFromFile());
        EXPECT_EQ(0, h.CountLog("already exists"));
        EXPECT_EQ(0, h.Stop());
    }
}

TEST_F(LifecycleTest, SigtermDuringStartUpEndsInOrderlyShutdown)
{
    pid_t launcher = h.Spawn({tarntest::BinPath("tarnaudiod")});
    ASSERT_GT(launcher, 0);
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
    usleep(100000);  // the daemon waits for the request; the signal lands there
    ASSERT_EQ(0, kill(pid, SIGTERM));
    usleep(100000);
    ControlRequest req = tarntest::MakeRequest(ACT_GET_STATUS);
    ASSERT_EQ(static_cast<ssize_t>(sizeof(req)), write(fd, &req, sizeof(req)));
    char reply[CTRL_REPLY_SIZE];
    size_t got = 0;
    for (ssize_t n; (n = read(fd, reply + got, sizeof(reply) - got)) > 0;)
        got += static_cast<size_t>(n);
    close(fd);
    EXPECT_EQ(sizeof(reply), got);
    EXPECT_NE(nullptr, strstr(reply, "\"PlayerState\""));
    EXPECT_EQ(0, h.WaitExit(pid, 15000));
    EXPECT_EQ(1, h.CountLog(kExit));
}

TEST_F(LifecycleTest, ShutdownZeroesTheSegmentsAndRestartReattaches)
{
    ASSERT_EQ(0, h.Start()) << h.Error();
    PlayerStatusShm *player = h.PlayerSegmentWritable();
    ASSERT_NE(nullptr, player);
    // mplayer-daemon's part (the first 4104 bytes) stays, the rest is zeroed.
    memset(player, 0xab, sizeof(*player));
    EXPECT_EQ(0, h.Request(ACT_SET_CHANGED));
    EXPECT_EQ(0, h.Stop());
    EXPECT_EQ(0u, Differ(player, 0, 4104, 0xab));
    EXPECT_EQ(0u, Differ(player, 4104, TARN_SHM_PLAYER_SIZE, 0));
    ASSERT_NE(nullptr, h.PublishedSegment());
    EXPECT_EQ(0u, Differ(h.PublishedSegment(), 0, TARN_SHM_PUBLISHED_SIZE, 0));
    // The segments outlive the daemon; a new start attaches without clearing.
    memset(player, 0xcd, sizeof(*player));
    ASSERT_EQ(0, h.Start()) << h.Error();
    EXPECT_EQ(0, h.Request(ACT_GET_STATUS));
    EXPECT_EQ(0u, Differ(player, 0, TARN_SHM_PLAYER_SIZE, 0xcd));
    EXPECT_EQ(0, h.Stop());
}

// A segment too small to attach is refused before the daemon detaches
// (program_options_test).

}  // namespace
