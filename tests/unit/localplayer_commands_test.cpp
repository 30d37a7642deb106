// LocalPlayer's command framings: one end of a socketpair is the player's
// connection, the test reads the other end.
#include <gtest/gtest.h>

#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "daemon/tarn_types.h"
#include "player/localplayer.h"
#include "player/playlist.h"
#include "tests/harness/harness.h"

namespace {

std::string Padded(const std::string &text) { return text + std::string(2048 - text.size(), '\0'); }

class LocalPlayerTest : public ::testing::Test {
protected:
    void SetUp() override { memset(&seg, 0, sizeof(seg)); }
    void TearDown() override
    {
        if (peer >= 0)
            close(peer);
        if (fakePid > 0) {
            kill(fakePid, SIGKILL);
            waitpid(fakePid, nullptr, 0);
        }
    }
    // Connects the player; a living child process is named by the pid file.
    void Connect(LocalPlayer &player)
    {
        fakePid = fork();
        ASSERT_GE(fakePid, 0);
        if (fakePid == 0)
            for (;;)
                pause();
        ASSERT_EQ(0, h.WriteFile(TARN_MPLAYER_PID_FILE, std::to_string(fakePid) + "\n"));
        int sv[2];
        ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, sv));
        ASSERT_EQ(0, player.AttachMplayerFd(sv[0]));
        peer = sv[1];
    }
    void Add(LocalPlayer &player, const std::string &path)
    {
        TARN_MEDIA_INFO info = tarntest::MakeMediaInfo(path);
        ASSERT_EQ(0, player.GetPlaylist()->AddSong(&info));
    }
    // Everything the player has written so far.
    std::string Received()
    {
        std::string out;
        char buf[8192];
        pollfd p = {peer, POLLIN, 0};
        for (ssize_t n; poll(&p, 1, 50) > 0 && (n = recv(peer, buf, sizeof(buf), MSG_DONTWAIT)) > 0;)
            out.append(buf, size_t(n));
        return out;
    }

    tarntest::Harness h;  // a fresh root for every fixed path
    PlayerStatusShm seg;
    pid_t fakePid = -1;
    int peer = -1;
};

TEST_F(LocalPlayerTest, RawAndPaddedFramings)
{
    LocalPlayer player;
    Connect(player);
    EXPECT_EQ(0, player.PlayPause());
    EXPECT_EQ("pause", Received());  // raw, no terminator
    // The seek offset is relative to the last reported position.
    seg.position = 30;
    ASSERT_EQ(0, player.Poll(&seg));
    EXPECT_EQ(0, player.Seek("100"));
    EXPECT_EQ(0, player.Seek("-5"));
    EXPECT_EQ(Padded("seek 70") + Padded("seek -30"), Received());
    EXPECT_EQ(0, player.SetVolume(150));
    EXPECT_EQ(100, player.GetVolume());
    EXPECT_EQ(0, player.Mute());
    const char gains[] = "1.0 2.0 3.0 4.0 5.0 -5.0 -4.0 -3.0 -2.0 -1.0";
    EXPECT_EQ(0, player.SetEqualizer(gains));
    EXPECT_EQ(Padded("setvol 100") + Padded("mute") + Padded(std::string("setequ ") + gains), Received());

    // Volume actions clamp at 0 and step by three.
    Json::Value reply;
    ControlRequest req;
    memset(&req, 0, sizeof(req));
    snprintf(req.parameter, sizeof(req.parameter), "2");
    for (int action : {ACT_SET_VOLUME, ACT_VOLUME_DOWN, ACT_VOLUME_UP}) {
        req.action = action;
        EXPECT_EQ(0, player.HandleAction(&req, reply));
    }
    EXPECT_EQ(3, player.GetVolume());
    EXPECT_EQ(Padded("setvol 2") + Padded("setvol 0") + Padded("setvol 3"), Received());

    // loadfile: raw, backslashes doubled, quotes as they are.
    Add(player, "/music/first.mp3");
    Add(player, "/music/dir\\x \"y\".flac");
    EXPECT_EQ(0, player.PlayIndex("1"));
    EXPECT_EQ("loadfile \"/music/dir\\\\x \"y\".flac\"", Received());
    EXPECT_EQ(0, player.PlayIndex("-4"));  // a negative index plays the first song
    EXPECT_EQ("loadfile \"/music/first.mp3\"", Received());
    EXPECT_EQ(0u, player.GetPlaylist()->Current());
    EXPECT_EQ(-1, player.PlayIndex("7"));
    EXPECT_NE(std::string::npos, h.Log().find("Failed to set index [7]"));
}

}  // namespace
