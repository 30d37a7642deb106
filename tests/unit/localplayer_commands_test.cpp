// LocalPlayer against a stand-in for mplayer-daemon: one end of a socketpair
// is the player's connection, the test reads the other end; a child process
// of the test is the "living player" named by the pid file; a script that
// records its arguments stands in for the executable.
#include <gtest/gtest.h>

#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
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
        EndFakePlayer();
    }
    // A living process named by the pid file.
    void StartFakePlayer()
    {
        fakePid = fork();
        ASSERT_GE(fakePid, 0);
        if (fakePid == 0)
            for (;;)
                pause();
        ASSERT_EQ(0, h.WriteFile(TARN_MPLAYER_PID_FILE, std::to_string(fakePid) + "\n"));
    }
    // Ends the fake player, after up to graceMs for a signal already sent
    // to arrive; returns the signal that ended it.
    int EndFakePlayer(int graceMs = 0)
    {
        int status = 0;
        for (int waited = 0; fakePid > 0 && waitpid(fakePid, &status, WNOHANG) == 0; waited += 10) {
            if (waited >= graceMs) {
                kill(fakePid, SIGKILL);
                waitpid(fakePid, &status, 0);
                break;
            }
            usleep(10000);
        }
        fakePid = -1;
        return WIFSIGNALED(status) ? WTERMSIG(status) : 0;
    }
    // Connects the player (with a living fake player) and queues paths.
    void Connect(LocalPlayer &player, std::initializer_list<const char *> paths = {})
    {
        if (fakePid <= 0)
            StartFakePlayer();
        if (peer >= 0)
            close(peer);
        int sv[2];
        ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, sv));
        ASSERT_EQ(0, player.AttachMplayerFd(sv[0]));
        peer = sv[1];
        for (const char *p : paths)
            Add(player, p);
    }
    void Add(LocalPlayer &player, const std::string &path, const std::string &title = "",
             const std::string &artist = "")
    {
        TARN_MEDIA_INFO info;
        memset(&info, 0, sizeof(info));
        snprintf(info.path, sizeof(info.path), "%s", path.c_str());
        snprintf(info.title, sizeof(info.title), "%s", title.c_str());
        snprintf(info.artist, sizeof(info.artist), "%s", artist.c_str());
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

TEST_F(LocalPlayerTest, NextAndPreviousSkipUnsupportedSongsAndStopAtTheEnd)
{
    LocalPlayer player;
    Connect(player, {"/m/a.mp3", "/m/notes.txt", "/m/noext", "/m/c.FLAC", "http://radio.example/s",
                     "/m/z.doc"});
    Playlist *q = player.GetPlaylist();
    EXPECT_EQ(0, player.Next(false));
    EXPECT_EQ(3u, q->Current());
    EXPECT_EQ(0, player.Next(false));
    EXPECT_EQ(0, player.Previous());
    EXPECT_EQ(0, player.Previous());
    EXPECT_EQ(0u, q->Current());
    EXPECT_EQ("loadfile \"/m/c.FLAC\"loadfile \"http://radio.example/s\"loadfile \"/m/c.FLAC\""
              "loadfile \"/m/a.mp3\"", Received());

    // Only unsupported songs remain: the player is stopped ("quit", then
    // SIGTERM since the fake ignores it). In "Repeat All" one round ends it.
    ASSERT_EQ(0, q->SetCurrent(4));
    EXPECT_EQ(-1, player.Next(false));
    EXPECT_EQ("quit", Received());
    EXPECT_EQ(-1, player.GetMplayerFd());
    EXPECT_EQ(0u, player.GetState());
    EXPECT_EQ(SIGTERM, EndFakePlayer(2000));

    LocalPlayer all;
    Connect(all, {"/m/x.txt", "/m/y.doc", "/m/z"});
    all.GetPlaylist()->SetMode(3);
    EXPECT_EQ(-1, all.Next(false));
    EXPECT_EQ("quit", Received());
}

TEST_F(LocalPlayerTest, PollReportsPublishesAndAdvancesAtSongEnd)
{
    LocalPlayer player;
    player.SetVolume(42);
    Connect(player, {"/m/a.mp3"});
    Add(player, "/m/sub/b.ogg", "", std::string(260, 'R'));
    EXPECT_EQ(-1, player.Poll(nullptr));
    EXPECT_NE(std::string::npos, h.Log().find("localplayer:336 Shared Memory is not attached."));
    ASSERT_EQ(0, player.GetPlaylist()->SetCurrent(1));
    snprintf(seg.currentUri, sizeof(seg.currentUri), "/m/sub/b.ogg");
    seg.duration = 180;
    seg.position = 61;
    seg.state = 3;
    EXPECT_EQ(0, player.Poll(&seg));
    EXPECT_EQ(3u, player.GetState());
    Json::Value st;
    player.GetStatusJson(st);
    EXPECT_EQ("/m/sub/b.ogg 180 61 42", st["CurrentUri"].asString() + " " + std::to_string(st["Duration"].asInt()) +
                                            " " + std::to_string(st["Position"].asInt()) + " " +
                                            std::to_string(st["Volume"].asInt()));
    PublishedStatusShm pub;
    memset(&pub, 0xAB, sizeof(pub));
    pub.changed = 7;
    EXPECT_EQ(0, player.PublishStatus(&pub));
    EXPECT_STREQ("/m/sub/b.ogg", pub.currentUri);
    EXPECT_EQ(180, pub.duration);
    EXPECT_EQ(61, pub.position);
    EXPECT_EQ(3, pub.state);
    EXPECT_EQ(1, pub.index);
    EXPECT_EQ(42, pub.volume);
    EXPECT_EQ(7, pub.changed);                      // the daemon's own field is left alone
    EXPECT_STREQ("b.ogg", pub.title);               // from the file name
    EXPECT_EQ(std::string(254, 'R'), pub.artist);   // cut, NUL-terminated
    // A radio stream: the stream title and the station name.
    snprintf(seg.radioStation, sizeof(seg.radioStation), "Tarn FM");
    snprintf(seg.streamTitle, sizeof(seg.streamTitle), "Live set");
    player.Poll(&seg);
    player.PublishStatus(&pub);
    EXPECT_STREQ("Live set", pub.title);
    EXPECT_STREQ("Tarn FM", pub.artist);

    // Song ended in "Repeat One": the same song again, the field reads 2,
    // handled once. "Normal": the next song, then at the end "quit".
    player.GetPlaylist()->SetMode(2);
    seg.state = 5;
    EXPECT_EQ(0, player.Poll(&seg));
    EXPECT_EQ(2, seg.state);
    EXPECT_EQ(0, player.Poll(&seg));
    EXPECT_EQ("loadfile \"/m/sub/b.ogg\"", Received());
    player.GetPlaylist()->SetMode(1);
    ASSERT_EQ(0, player.GetPlaylist()->SetCurrent(0));
    for (const char *want : {"loadfile \"/m/sub/b.ogg\"", "quit"}) {
        seg.state = 5;
        EXPECT_EQ(0, player.Poll(&seg));
        EXPECT_EQ(want, Received());
    }
    EXPECT_EQ(-1, player.GetMplayerFd());
}

// The argument vector mplayer-daemon is started with, from the stored volume
// and the default equalizer profile.
TEST_F(LocalPlayerTest, StartArgumentsCarryVolumeAndEqualizer)
{
    std::string exe = h.Path(TARN_MPLAYER_BIN), args = h.Path("/args.txt");
    ASSERT_EQ(0, h.WriteFile(TARN_MPLAYER_BIN, "#!/bin/sh\nfor a in \"$0\" \"$@\"; do echo \"$a\"; done > '" +
                                                   args + ".tmp'\necho END >> '" + args + ".tmp'\nmv '" + args +
                                                   ".tmp' '" + args + "'\n"));
    ASSERT_EQ(0, chmod(exe.c_str(), 0755));
    LocalPlayer empty;
    EXPECT_EQ(-1, empty.PlayPause());  // nothing to play
    h.WriteFile(TARN_INFO_CONF, "audio_volume=\"35\"\naudio_enable_equalizer=yes\naudio_default_equalizer=Rock\n");
    h.WriteFile("/usr/tarn/etc.defaults/audio/equalizer.system",
                "Pop:1.0 1.0 1.0 1.0 1.0 1.0 1.0 1.0 1.0 1.0\nRock: 4.0 3.0 -1.0 -2.0 0.0 1.0 2.5 3.0 3.5 4.0 \n");
    LocalPlayer player;
    Add(player, "/m/a b.mp3");
    EXPECT_EQ(0, player.PlayPause());
    for (int i = 0; i < 200 && h.ReadFile("/args.txt").find("END") == std::string::npos; ++i)
        usleep(10000);
    EXPECT_EQ(exe + "\n/m/a b.mp3\n-loop\n0\n-daemon\n-volume\n35\n-af\n"
                    "equalizer=4.0:3.0:-1.0:-2.0:0.0:1.0:2.5:3.0:3.5:4.0\nEND\n",
              h.ReadFile("/args.txt"));
    EXPECT_EQ(2u, player.GetState());
}

}  // namespace
