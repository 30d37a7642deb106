// Process utilities (pid files, liveness, kill by name scoped to the root)
// and the status segment operations.
#include <gtest/gtest.h>

#include <csignal>
#include <cstring>
#include <string>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <unistd.h>

#include "daemon/shm.h"
#include "platform/tlibc_proc.h"
#include "tests/harness/harness.h"

namespace {

TEST(Proc, PidFilesAndZombies)
{
    tarntest::Harness h;
    std::string path = h.Path("/var/run/x.pid");
    EXPECT_LE(TLIBCReadPidFile(path.c_str()), 0);
    EXPECT_EQ(-1, TLIBCProcSignalByPidFile(path.c_str(), 0));
    for (const char *bad : {"garbage\n", "999999999999\n"}) {
        ASSERT_EQ(0, h.WriteFile("/var/run/x.pid", bad));
        EXPECT_LE(TLIBCReadPidFile(path.c_str()), 0) << bad;
    }
    ASSERT_EQ(0, TLIBCProcPidFileCreate(path.c_str()));
    EXPECT_EQ(std::to_string(getpid()) + "\n", h.ReadFile("/var/run/x.pid"));
    EXPECT_EQ(1, TLIBCProcAliveByPidFile(path.c_str()));
    EXPECT_EQ(-1, TLIBCProcPidFileCreate(h.Path("/no/such/dir/x.pid").c_str()));
    // A child that ended but is not reaped is no running process.
    pid_t child = h.Spawn({"/bin/true"});
    ASSERT_GT(child, 0);
    usleep(200000);
    EXPECT_EQ(0, TLIBCProcAlive(child));
    ASSERT_EQ(0, h.WriteFile("/var/run/x.pid", std::to_string(child)));
    EXPECT_EQ(0, TLIBCProcAliveByPidFile(path.c_str()));
    EXPECT_EQ(-1, TLIBCProcSignalByPidFile(path.c_str(), SIGTERM));
    EXPECT_EQ(0, h.WaitExit(child, 2000));
}

TEST(Proc, KillByNameOnlyTouchesProgramsUnderTheRootAndEscalates)
{
    tarntest::Harness h;
    std::string inside = h.Path("/usr/tarn/bin/tarn-sleeper");
    char outsideDir[] = "/tmp/tarnout.XXXXXX";
    ASSERT_NE(nullptr, mkdtemp(outsideDir));
    std::string outside = std::string(outsideDir) + "/tarn-sleeper";
    std::string stubborn = h.Path("/usr/tarn/bin/tarn-stubborn");
    ASSERT_EQ(0, h.Run({"/bin/cp", "/bin/sleep", inside}));
    ASSERT_EQ(0, h.Run({"/bin/cp", "/bin/sleep", outside}));
    ASSERT_EQ(0, h.Run({"/bin/cp", "/bin/sh", stubborn}));
    pid_t in = h.Spawn({inside, "30"});
    pid_t out = h.Spawn({outside, "30"});
    pid_t st = h.Spawn({stubborn, "-c", "trap '' TERM; while :; do sleep 0.1; done"});
    ASSERT_GT(in, 0);
    ASSERT_GT(out, 0);
    ASSERT_GT(st, 0);
    usleep(200000);
    EXPECT_EQ(1, TLIBCKill("tarn-sleeper", SIGTERM));
    EXPECT_EQ(-2, h.WaitExit(in, 3000));
    EXPECT_EQ(1, TLIBCProcAlive(out));
    EXPECT_EQ(1, TLIBCKill("tarn-stubborn", 0));
    EXPECT_EQ(-2, h.WaitExit(st, 3000));
    kill(out, SIGKILL);
    h.WaitExit(out, 3000);
    unlink(outside.c_str());
    rmdir(outsideDir);
}

TEST(Shm, CreateReattachRemoveAndFailures)
{
    tarntest::Harness h;
    int key = h.PlayerKey() + 100;
    ShmRemove(key, 4640);
    h.ClearLog();
    EXPECT_EQ(nullptr, ShmCreateAttach(key, 4640, 0));
    EXPECT_EQ(1, h.CountLog("shm:35 Failed to create shared memory. key[" + std::to_string(key) + "], size[4640], ["));
    char *p = static_cast<char *>(ShmCreateAttach(key, 4640, 1));
    ASSERT_NE(nullptr, p);
    memset(p, 0x5a, 4640);
    EXPECT_EQ(0, ShmDetach(p));
    EXPECT_EQ(-1, ShmDetach(p));
    EXPECT_EQ(1, h.CountLog("shm:52 Failed to detach shared memory."));
    struct shmid_ds ds;
    ASSERT_EQ(0, shmctl(shmget(key, 0, 0), IPC_STAT, &ds));
    EXPECT_EQ(0666u, ds.shm_perm.mode & 0777u);
    char *q = static_cast<char *>(ShmCreateAttach(key, 4640, 0));
    ASSERT_NE(nullptr, q);
    EXPECT_EQ(0x5a, q[4639]) << "attaching again sees the old contents";
    EXPECT_EQ(0, ShmDetach(q));
    EXPECT_EQ(0, ShmRemove(key, 4640));
    EXPECT_EQ(-1, ShmRemove(key, 4640));
    EXPECT_EQ(1, h.CountLog("shm:66 Get shared memory fail. Might not exist.("));
    ASSERT_EQ(0, tarntest::Harness::CreateSegment(key, 100));
    EXPECT_EQ(nullptr, ShmCreateAttach(key, 4640, 1)) << "too small";
    EXPECT_EQ(2, h.CountLog("shm:35 Failed to create shared memory."));
    ShmRemove(key, 100);
}

}  // namespace
