// The control socket and the status segments belong to the configured group:
// its members use tarnctl, others are told "permission denied"; the player
// socket is the daemon user's alone.
#include <gtest/gtest.h>

#include <grp.h>
#include <string>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <unistd.h>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

const uid_t kNobody = 65534;

class GroupAccessTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    void SetUp() override
    {
        ASSERT_TRUE(tarntest::InPrivateNetns());
        ASSERT_EQ(0u, getuid()) << "the test switches users: it runs as root";
        // Others must reach the socket's folder: only its own mode decides.
        ASSERT_EQ(0, chmod(h.Root().c_str(), 0755));
    }
    // tarnctl as the user nobody with the given group and no others.
    int CtlAs(gid_t gid, const std::vector<std::string> &args, std::string *out)
    {
        std::vector<std::string> argv = {"/usr/bin/setpriv", "--reuid=" + std::to_string(kNobody),
                                         "--regid=" + std::to_string(gid), "--clear-groups",
                                         tarntest::BinPath("tarnctl")};
        argv.insert(argv.end(), args.begin(), args.end());
        return h.Run(argv, out);
    }
    struct shmid_ds Segment(int key)
    {
        struct shmid_ds ds = {};
        EXPECT_EQ(0, shmctl(shmget(key, 0, 0), IPC_STAT, &ds));
        return ds;
    }
};

TEST_F(GroupAccessTest, MembersOfTheGroupControlTheDaemonOthersAreDenied)
{
    struct group *g = getgrnam("audio");
    ASSERT_NE(nullptr, g) << "Debian has an audio group";
    gid_t audio = g->gr_gid;
    struct group *other = getgrnam("nogroup");
    ASSERT_NE(nullptr, other);
    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "admin_port=8580\n"));  // audio_group: default
    ASSERT_EQ(0, h.Start()) << h.Error();

    struct stat st;
    ASSERT_EQ(0, stat(h.Path(TARN_CTRL_SOCKET).c_str(), &st));
    EXPECT_EQ(0660u, st.st_mode & 07777);
    EXPECT_EQ(audio, st.st_gid);
    ASSERT_EQ(0, stat(h.Path(TARN_MPLAYER_SOCKET).c_str(), &st));
    EXPECT_EQ(0600u, st.st_mode & 07777);
    for (int key : {h.PlayerKey(), h.PublishedKey()}) {
        struct shmid_ds ds = Segment(key);
        EXPECT_EQ(0640u, ds.shm_perm.mode & 0777) << key;
        EXPECT_EQ(audio, ds.shm_perm.gid) << key;
    }

    std::string out;
    EXPECT_EQ(0, CtlAs(audio, {"volume", "33"}, &out)) << out;
    EXPECT_EQ(0, CtlAs(audio, {"--json", "status"}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("\"Volume\" : 33")) << out;
    EXPECT_EQ(0, CtlAs(audio, {"watch", "--count", "1"}, &out)) << out;

    EXPECT_EQ(1, CtlAs(other->gr_gid, {"status"}, &out));
    EXPECT_NE(std::string::npos, out.find("tarnctl: permission denied: " + h.Path(TARN_CTRL_SOCKET))) << out;
    EXPECT_EQ(std::string::npos, out.find("not running")) << out;
    EXPECT_EQ(1, CtlAs(other->gr_gid, {"watch", "--count", "1"}, &out));
    EXPECT_NE(std::string::npos, out.find("tarnctl: permission denied: the status segment")) << out;
    EXPECT_EQ(0, h.Stop());

    // Another group from the configuration; the next start takes it, also
    // for the segments that are still there from the last run.
    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "audio_group=nogroup\n"));
    ASSERT_EQ(0, h.Start()) << h.Error();
    EXPECT_EQ(0, CtlAs(other->gr_gid, {"status"}, &out)) << out;
    EXPECT_EQ(1, CtlAs(audio, {"status"}, &out));
    EXPECT_NE(std::string::npos, out.find("permission denied")) << out;
    EXPECT_EQ(other->gr_gid, Segment(h.PublishedKey()).shm_perm.gid);
    EXPECT_EQ(0, h.Stop());

    // A group that does not exist: the daemon's own group, still not others.
    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "audio_group=no-such-group\n"));
    ASSERT_EQ(0, h.Start()) << h.Error();
    ASSERT_EQ(0, stat(h.Path(TARN_CTRL_SOCKET).c_str(), &st));
    EXPECT_EQ(getgid(), st.st_gid);
    EXPECT_EQ(0660u, st.st_mode & 07777);
    EXPECT_EQ(1, CtlAs(audio, {"status"}, &out));
    EXPECT_TRUE(h.WaitLog("No group [no-such-group] (audio_group)")) << h.Log();
    EXPECT_EQ(0, h.Stop());
}

}  // namespace
