// Process utilities: pid files, liveness (zombies count as dead), signalling
// by pid file and by name (scoped to TARN_ROOT), starting programs.
#include <gtest/gtest.h>

#include <csignal>
#include <cstdlib>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/tlibc_proc.h"
#include "tests/harness/harness.h"

namespace {

class ProcTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    bool WaitFile(const std::string &fixed, int ms = 5000)
    {
        for (int i = 0; i < ms / 10; ++i) {
            if (h.Exists(fixed.c_str()) && !h.ReadFile(fixed.c_str()).empty())
                return true;
            usleep(10000);
        }
        return false;
    }
};

TEST_F(ProcTest, PidFiles)
{
    std::string path = h.Path("/var/run/x.pid");
    EXPECT_LE(TLIBCReadPidFile(path.c_str()), 0);
    EXPECT_EQ(0, TLIBCProcAliveByPidFile(path.c_str()));
    EXPECT_EQ(-1, TLIBCProcSignalByPidFile(path.c_str(), 0));
    ASSERT_EQ(0, h.WriteFile("/var/run/x.pid", "garbage\n"));
    EXPECT_LE(TLIBCReadPidFile(path.c_str()), 0);
    ASSERT_EQ(0, h.WriteFile("/var/run/x.pid", "999999999999\n"));
    EXPECT_LE(TLIBCReadPidFile(path.c_str()), 0);

    ASSERT_EQ(0, TLIBCProcPidFileCreate(path.c_str()));
    EXPECT_EQ(std::to_string(getpid()) + "\n", h.ReadFile("/var/run/x.pid"));
    EXPECT_EQ(getpid(), TLIBCReadPidFile(path.c_str()));
    EXPECT_EQ(1, TLIBCProcAliveByPidFile(path.c_str()));
    EXPECT_EQ(0, TLIBCProcSignalByPidFile(path.c_str(), 0));
    EXPECT_EQ(-1, TLIBCProcPidFileCreate(h.Path("/no/such/dir/x.pid").c_str()));
}

TEST_F(ProcTest, ZombiesAndEndedProcessesAreDead)
{
    EXPECT_EQ(1, TLIBCProcAlive(getpid()));
    EXPECT_EQ(0, TLIBCProcAlive(0));
    EXPECT_EQ(0, TLIBCProcAlive(-5));
    pid_t child = h.Spawn({"/bin/true"});
    ASSERT_GT(child, 0);
    usleep(200000);  // ended, not reaped: a zombie
    EXPECT_EQ(0, TLIBCProcAlive(child));
    ASSERT_EQ(0, h.WriteFile("/var/run/z.pid", std::to_string(child)));
    EXPECT_EQ(0, TLIBCProcAliveByPidFile(h.Path("/var/run/z.pid").c_str()));
    EXPECT_EQ(-1, TLIBCProcSignalByPidFile(h.Path("/var/run/z.pid").c_str(), SIGTERM));
    EXPECT_EQ(0, h.WaitExit(child, 2000));
}

TEST_F(ProcTest, ExecvWaitsOrDetaches)
{
    char *const ok[] = {const_cast<char *>("/bin/sh"), const_cast<char *>("-c"),
                        const_cast<char *>("exit 3"), nullptr};
    EXPECT_EQ(3, TLIBCExecv("/bin/sh", ok, 0));
    char *const missing[] = {const_cast<char *>("/no/such/program"), nullptr};
    EXPECT_EQ(-1, TLIBCExecv("/no/such/program", missing, 0));
    EXPECT_EQ(-1, TLIBCExecv("/no/such/program", missing, 1));

    // Detached: environment passed on, no inherited descriptors beyond 0-2.
    const int keep = 57;  // a descriptor the program must not see
    ASSERT_EQ(keep, dup2(1, keep));
    std::string script = "echo \"$TARN_ROOT\" > " + h.Path("/tmp/env.txt") + "; ls /proc/self/fd > " +
                         h.Path("/tmp/fds.tmp") + "; mv " + h.Path("/tmp/fds.tmp") + " " +
                         h.Path("/tmp/fds.txt");
    char *const argv[] = {const_cast<char *>("/bin/sh"), const_cast<char *>("-c"),
                          const_cast<char *>(script.c_str()), nullptr};
    EXPECT_EQ(0, TLIBCExecv("/bin/sh", argv, 1));
    ASSERT_TRUE(WaitFile("/tmp/fds.txt"));
    close(keep);
    EXPECT_EQ(h.Root() + "\n", h.ReadFile("/tmp/env.txt"));
    // ls itself opens one descriptor for the directory it lists.
    std::string fds = "\n" + h.ReadFile("/tmp/fds.txt");
    EXPECT_EQ(std::string::npos, fds.find("\n57\n")) << fds;
    EXPECT_NE(std::string::npos, fds.find("\n2\n")) << fds;
    h.WaitAllChildren(2000);
}

TEST_F(ProcTest, KillByNameOnlyTouchesProgramsUnderTheRoot)
{
    // The same program name inside and outside the root.
    std::string inside = h.Path("/usr/tarn/bin/tarn-sleeper");
    char outsideDir[] = "/tmp/tarnout.XXXXXX";
    ASSERT_NE(nullptr, mkdtemp(outsideDir));
    std::string outside = std::string(outsideDir) + "/tarn-sleeper";
    ASSERT_EQ(0, h.Run({"/bin/cp", "/bin/sleep", inside}));
    ASSERT_EQ(0, h.Run({"/bin/cp", "/bin/sleep", outside}));
    pid_t in = h.Spawn({inside, "30"});
    pid_t out = h.Spawn({outside, "30"});
    ASSERT_GT(in, 0);
    ASSERT_GT(out, 0);
    usleep(100000);

    EXPECT_EQ(1, TLIBCKill("tarn-sleeper", SIGTERM));
    EXPECT_EQ(-2, h.WaitExit(in, 3000));
    EXPECT_EQ(1, TLIBCProcAlive(out));
    EXPECT_EQ(0, TLIBCKill("tarn-sleeper", 0));  // nothing left under the root

    kill(out, SIGKILL);
    h.WaitExit(out, 3000);
    unlink(outside.c_str());
    rmdir(outsideDir);
}

TEST_F(ProcTest, KillByNameEscalatesWhenTheProgramIgnoresSigterm)
{
    std::string inside = h.Path("/usr/tarn/bin/tarn-stubborn");
    ASSERT_EQ(0, h.Run({"/bin/cp", "/bin/sh", inside}));
    pid_t p = h.Spawn({inside, "-c", "trap '' TERM; while :; do sleep 0.1; done"});
    ASSERT_GT(p, 0);
    usleep(200000);
    EXPECT_EQ(1, TLIBCKill("tarn-stubborn", 0));
    EXPECT_EQ(-2, h.WaitExit(p, 3000));
    h.WaitAllChildren(2000);
}

}  // namespace
