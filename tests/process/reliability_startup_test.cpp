// Faults around the daemon's own life: SIGTERM at many points of start-up,
// a daemon killed with SIGKILL (stale pid file, socket files and segments
// left behind) and started again, and a restart that finds a segment of
// the wrong size under its key.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <set>
#include <string>
#include <thread>

#include <json/json.h>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

using tarntest::Harness;

const char kExit[] = "tarnaudiod exit";

class StartupFaults : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run"; }
    void TearDown() override
    {
        if (HasFailure())
            fprintf(stderr, "--- daemon log ---\n%s\n", h.Log().c_str());
    }
    Harness h;
};

// SIGTERM at a spread of moments after the launch: to the launching
// process while no pid file exists yet, else to the daemon the pid file
// names. Whatever the moment, every process ends within the time-out, none
// with an error status, the daemon leaves neither pid file nor socket
// behind, logs its exit at most once, and the next start works.
TEST_F(StartupFaults, SigtermAtManyPointsOfStartUp)
{
    const int delaysUs[] = {0, 200, 1000, 3000, 6000, 10000, 20000, 40000, 80000, 150000, 300000};
    for (int delay : delaysUs) {
        SCOPED_TRACE("delay " + std::to_string(delay) + " us");
        h.ClearLog();
        std::set<pid_t> before;
        for (const auto &r : h.Reaped())
            before.insert(r.first);
        pid_t launcher = h.Spawn({tarntest::BinPath("tarnaudiod")});
        ASSERT_GT(launcher, 0);
        if (delay > 0)
            usleep(delay);
        int pid = h.PidFromFile();
        pid_t target = (pid > 0 && pid != launcher) ? pid : launcher;
        kill(target, SIGTERM);
        // The launcher may already have handed over to the daemon before its
        // pid file appeared: a daemon that shows up later gets its SIGTERM
        // then (a later point of the same start-up).
        bool ended = false;
        std::set<int> signalled = {target};
        for (int i = 0; i < 300 && !ended; ++i) {
            h.Reap();
            int p = h.PidFromFile();
            if (p > 0 && signalled.count(p) == 0 && kill(p, 0) == 0) {
                kill(p, SIGTERM);
                signalled.insert(p);
            }
            ended = h.WaitAllChildren(50) == 0;
        }
        ASSERT_TRUE(ended) << "a process did not end after SIGTERM";
        for (const auto &r : h.Reaped()) {
            if (before.count(r.first))
                continue;
            // The launcher may die of the signal before it has any handler;
            // the daemon itself holds SIGTERM until its handler is in place.
            bool ok = (WIFEXITED(r.second) && WEXITSTATUS(r.second) == 0) ||
                      (r.first == launcher && WIFSIGNALED(r.second) && WTERMSIG(r.second) == SIGTERM);
            EXPECT_TRUE(ok) << "pid " << r.first << " status " << r.second;
            if (r.first != launcher) {
                EXPECT_FALSE(WIFSIGNALED(r.second)) << "the daemon died of signal " << WTERMSIG(r.second);
            }
        }
        printf("delay %6d us: SIGTERM to the %s, %zu process(es) ended, exit logged %d time(s)\n",
               delay, target == launcher ? "launcher" : "daemon", h.Reaped().size() - before.size(),
               h.CountLog(kExit));
        EXPECT_LE(h.CountLog(kExit), 1);
        EXPECT_FALSE(h.Exists(TARN_PID_FILE));
        EXPECT_FALSE(h.Exists(TARN_CTRL_SOCKET));
        if (HasFailure())
            break;
    }
    // Nothing left behind stands in the way of a normal start.
    ASSERT_EQ(0, h.Start()) << h.Error();
    EXPECT_EQ(0, h.Request(ACT_GET_STATUS));
    EXPECT_EQ(0, h.Stop());
}

// A daemon killed with SIGKILL under load leaves its pid file, both socket
// files and both segments. The next start takes over: it answers, keeps
// the player segment's contents (same size: attached, not cleared), and
// serves the same clients.
TEST_F(StartupFaults, RestartAfterSigkill)
{
    ASSERT_EQ(0, h.Start()) << h.Error();
    pid_t first = h.Pid();
    for (int i = 0; i < 3; ++i)
        ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/share/Music/a" + std::to_string(i) + ".mp3")));
    PlayerStatusShm *player = h.PlayerSegmentWritable();
    ASSERT_NE(nullptr, player);
    memset(player, 0x5a, 4104);  // mplayer-daemon's part

    // Killed while clients keep coming.
    std::thread clients([&] {
        for (int i = 0; i < 50; ++i) {
            int fd = h.Connect();
            if (fd < 0)
                break;
            ControlRequest req = tarntest::MakeRequest(ACT_GET_STATUS);
            if (write(fd, &req, sizeof(req)) < 0) {
            }
            close(fd);
        }
    });
    usleep(20000);
    ASSERT_EQ(0, kill(first, SIGKILL));
    clients.join();
    EXPECT_EQ(-2, h.WaitExit(first, 5000));
    h.Stop(100);  // the harness lets go of the dead daemon
    EXPECT_TRUE(h.Exists(TARN_PID_FILE));
    EXPECT_TRUE(h.Exists(TARN_CTRL_SOCKET));

    ASSERT_EQ(0, h.Start()) << h.Error();
    EXPECT_NE(first, h.Pid());
    std::string reply;
    ASSERT_EQ(0, h.Request(ACT_QUEUE_LIST, "0 10", &reply));
    Json::Value v;
    ASSERT_TRUE(Json::Reader().parse(reply, v));
    EXPECT_EQ(0, v["total"].asInt()) << "the queue is not kept over a restart";
    const unsigned char *raw = reinterpret_cast<const unsigned char *>(player);
    size_t changed = 0;
    for (size_t i = 0; i < 4104; ++i)
        changed += raw[i] != 0x5a;
    EXPECT_EQ(0u, changed) << "the restart cleared mplayer-daemon's part of the segment";
    EXPECT_EQ(0, h.Stop());
}

// After a crash, a segment under the published key with a smaller size
// (left by an older program): the start stops, exit status 0 for every
// process, the reason logged, no pid file and no socket left. Once the
// segment is gone the daemon starts and creates it in full size.
TEST_F(StartupFaults, RestartMeetsSmallerSegment)
{
    ASSERT_EQ(0, h.Start()) << h.Error();
    pid_t first = h.Pid();
    ASSERT_EQ(0, kill(first, SIGKILL));
    EXPECT_EQ(-2, h.WaitExit(first, 5000));
    h.Stop(100);  // the harness lets go of the dead daemon
    h.DetachSegments();
    h.RemoveSegments();
    ASSERT_EQ(0, Harness::CreateSegment(h.PublishedKey(), 128));
    h.ClearLog();
    std::set<pid_t> before;
    for (const auto &r : h.Reaped())
        before.insert(r.first);

    std::string out;
    EXPECT_EQ(0, h.Launch(&out));
    ASSERT_EQ(0, h.WaitAllChildren(15000));
    for (const auto &r : h.Reaped()) {
        if (before.count(r.first) == 0) {
            EXPECT_TRUE(WIFEXITED(r.second) && WEXITSTATUS(r.second) == 0) << r.first << " " << r.second;
        }
    }
    EXPECT_TRUE(h.WaitLog("Failed to create shared memory"));
    EXPECT_EQ(1, h.CountLog(kExit));
    EXPECT_FALSE(h.Exists(TARN_PID_FILE));
    EXPECT_FALSE(h.Exists(TARN_CTRL_SOCKET));

    h.RemoveSegments();
    ASSERT_EQ(0, h.Start()) << h.Error();
    int id = shmget(h.PublishedKey(), 0, 0);
    ASSERT_GE(id, 0);
    struct shmid_ds ds;
    ASSERT_EQ(0, shmctl(id, IPC_STAT, &ds));
    EXPECT_EQ(static_cast<size_t>(TARN_SHM_PUBLISHED_SIZE), ds.shm_segsz);
    EXPECT_EQ(0, h.Stop());
}

}  // namespace
