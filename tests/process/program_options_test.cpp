// Every program answers --help and --version without side effects and
// treats an unknown option as a usage error; tarnaudiod refuses to start,
// on standard error and with status 1, when its folders, sockets or segments
// cannot work, and --foreground keeps it attached with its log on stderr.
#include <gtest/gtest.h>

#include <csignal>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include "daemon/tarn_types.h"
#include "platform/tarn_version.h"
#include "platform/tlibc_proc.h"
#include "tests/harness/harness.h"

namespace {

using tarntest::BinPath;

const char *const kPrograms[] = {"tarnaudiod", "tarnctl", "tarnlib", "tarnweb", "mplayer-daemon"};

class ProgramOptionsTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    void SetUp() override { ASSERT_TRUE(tarntest::InPrivateNetns()); }

    // Names of everything under the root (the folders the root starts with
    // are the same every time).
    std::string Listing() const
    {
        std::string all;
        for (const auto &e : std::filesystem::recursive_directory_iterator(h.Root()))
            all += e.path().string() + "\n";
        return all;
    }
    bool SegmentExists(int key) const { return shmget(key, 0, 0) >= 0; }
    // Launches tarnaudiod expecting a refusal: status 1 and the text.
    void ExpectRefused(const std::string &needle)
    {
        std::string out;
        EXPECT_EQ(1, h.Launch(&out)) << out;
        EXPECT_NE(std::string::npos, out.find(needle)) << out;
        EXPECT_NE(std::string::npos, out.find("tarnaudiod: not started")) << out;
        EXPECT_EQ(0, h.WaitAllChildren(5000));
        EXPECT_FALSE(h.Exists(TARN_PID_FILE));
        EXPECT_EQ(0, h.CountLog("tarnaudiod exit")) << "the daemon must not have started";
    }
};

TEST_F(ProgramOptionsTest, HelpVersionAndUnknownOptionsOfEveryProgram)
{
    std::string before = Listing();
    for (const char *name : kPrograms) {
        SCOPED_TRACE(name);
        std::string out;
        EXPECT_EQ(0, h.Run({BinPath(name), "--help"}, &out));
        EXPECT_NE(std::string::npos, out.find("usage: " + std::string(name))) << out;
        EXPECT_EQ(0, h.Run({BinPath(name), "--version"}, &out));
        EXPECT_EQ(std::string(name) + " " + TARN_VERSION + "\n", out);
        EXPECT_EQ(2, h.Run({BinPath(name), "--no-such-option"}, &out));
        EXPECT_NE(std::string::npos, out.find("--no-such-option")) << out;
    }
    EXPECT_EQ(0, h.WaitAllChildren(5000)) << "a program stayed running";
    // Nothing was started or created: no pid file, socket, log or segment.
    EXPECT_EQ(before, Listing());
    EXPECT_FALSE(SegmentExists(h.PlayerKey()));
    EXPECT_FALSE(SegmentExists(h.PublishedKey()));
}

TEST_F(ProgramOptionsTest, StartIsRefusedOnStandardErrorWhenItCannotWork)
{
    {
        SCOPED_TRACE("pid file folder missing");
        std::filesystem::remove_all(h.Path("/var/run"));
        ExpectRefused("folder " + h.Path("/var/run") + " of the pid file is missing");
        std::filesystem::create_directories(h.Path("/var/run"));
    }
    {
        SCOPED_TRACE("socket folder missing");
        std::filesystem::remove_all(h.Path("/tmp"));
        ExpectRefused("folder " + h.Path("/tmp") + " of the socket is missing");
        std::filesystem::create_directories(h.Path("/tmp"));
    }
    {
        SCOPED_TRACE("a folder where the control socket goes");
        std::filesystem::create_directories(h.Path(TARN_CTRL_SOCKET));
        ExpectRefused(h.Path(TARN_CTRL_SOCKET) + " is a folder, not a socket");
        std::filesystem::remove_all(h.Path(TARN_CTRL_SOCKET));
    }
    {
        SCOPED_TRACE("another program listens on the control socket");
        int fd = socket(AF_UNIX, SOCK_STREAM, 0);
        struct sockaddr_un addr;
        memset(&addr, 0, sizeof(addr));
        addr.sun_family = AF_UNIX;
        snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", h.Path(TARN_CTRL_SOCKET).c_str());
        ASSERT_EQ(0, bind(fd, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr)));
        ASSERT_EQ(0, listen(fd, 5));
        ExpectRefused("another process answers on " + h.Path(TARN_CTRL_SOCKET));
        close(fd);
        // Left behind by a process that has gone: not in the way.
        ASSERT_EQ(0, h.Start()) << h.Error();
        EXPECT_EQ(0, h.Stop());
    }
    {
        SCOPED_TRACE("a root whose socket paths do not fit");
        std::string longRoot = h.Root() + "/" + std::string(100, 'r');
        std::string out;
        EXPECT_EQ(1, h.Run({"/usr/bin/env", "TARN_ROOT=" + longRoot, BinPath("tarnaudiod")}, &out));
        EXPECT_NE(std::string::npos, out.find("is longer than 107 characters")) << out;
        EXPECT_EQ(0, h.WaitAllChildren(5000));
    }
}

TEST_F(ProgramOptionsTest, TooSmallExistingSegmentIsReportedBeforeDetaching)
{
    for (int which = 0; which < 2; ++which) {
        SCOPED_TRACE(which);
        h.RemoveSegments();
        h.ClearLog();
        int key = which == 0 ? h.PlayerKey() : h.PublishedKey();
        ASSERT_EQ(0, tarntest::Harness::CreateSegment(key, 64));
        char name[16];
        snprintf(name, sizeof(name), "0x%x", key);
        ExpectRefused(std::string("shared memory segment ") + name + " exists but cannot be used (smaller than " +
                      std::to_string(which == 0 ? TARN_SHM_PLAYER_SIZE : TARN_SHM_PUBLISHED_SIZE) +
                      " bytes)");
        EXPECT_FALSE(h.Exists(TARN_CTRL_SOCKET));
    }
}

TEST_F(ProgramOptionsTest, ForegroundStaysAttachedLogsToStderrAndStopsOnCtrlC)
{
    std::string err = h.Path("/fg.err");
    // Without the player program the start goes on with a warning.
    std::filesystem::remove(h.Path(TARN_MPLAYER_BIN));
    pid_t pid = h.Spawn({"/bin/sh", "-c", "exec '" + BinPath("tarnaudiod") + "' --foreground 2>'" + err + "'"});
    ASSERT_GT(pid, 0);
    std::string reply;
    int rc = -1;
    for (int i = 0; i < 300 && rc != 0; ++i) {
        if (h.Exists(TARN_CTRL_SOCKET))
            rc = h.Request(ACT_GET_STATUS, nullptr, &reply, 1000);
        if (rc != 0)
            usleep(20000);
    }
    ASSERT_EQ(0, rc) << h.Log();
    EXPECT_EQ(pid, h.PidFromFile()) << "the daemon detached";
    EXPECT_EQ(-1, h.WaitExit(pid, 200)) << "the foreground daemon ended";
    ASSERT_EQ(0, kill(pid, SIGINT));
    EXPECT_EQ(0, h.WaitExit(pid, 10000));
    EXPECT_FALSE(h.Exists(TARN_PID_FILE));
    EXPECT_FALSE(h.Exists(TARN_CTRL_SOCKET));
    std::ifstream in(err);
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    EXPECT_NE(std::string::npos, text.find("tarnaudiod: warning: cannot run " + h.Path(TARN_MPLAYER_BIN))) << text;
    EXPECT_NE(std::string::npos, text.find("tarnaudiod: tarnaudiod:530 tarnaudiod exit\n")) << text;
    EXPECT_EQ(1, h.CountLog("tarnaudiod:530 tarnaudiod exit")) << "the log file still gets every line";
}

}  // namespace
