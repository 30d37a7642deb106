// LocalPlayer against a stand-in for mplayer-daemon: one end of a socketpair
// is the player's connection, the test reads the other end; a child process
// of the test is the "living player" named by the pid file; a script that
// records its arguments stands in for the executable.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>

#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"
#include "player/localplayer.h"
#include "player/playlist.h"

namespace {

// Every fixed path of this process lies under one temporary root.
std::string MakeRoot()
{
    char tmpl[] = "/tmp/localplayer-unit.XXXXXX";
    if (!mkdtemp(tmpl))
        abort();
    setenv("TARN_ROOT", tmpl, 1);
    setenv("TARN_LOG_FILE", (std::string(tmpl) + "/log.txt").c_str(), 1);
    return tmpl;
}
const std::string g_root = MakeRoot();

std::string ReadFile(const std::string &path)
{
    std::ifstream in(path);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}
void WriteFile(const std::string &path, const std::string &text)
{
    ASSERT_EQ(0, system(("mkdir -p \"$(dirname '" + path + "')\"").c_str()));
    std::ofstream(path) << text;
}
std::string Log() { return ReadFile(g_root + "/log.txt"); }
std::string Padded(const std::string &text)
{
    std::string s = text;
    s.resize(2048, '\0');
    return s;
}

class LocalPlayerTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        signal(SIGPIPE, SIG_IGN);
        ASSERT_EQ(0, system(("rm -rf '" + g_root + "'/* && mkdir -p '" + g_root + "/var/run'").c_str()));
        memset(&seg, 0, sizeof(seg));
    }
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
        WriteFile(TarnPath(TARN_MPLAYER_PID_FILE), std::to_string(fakePid) + "\n");
    }
    // Ends the fake player after up to graceMs for a signal already sent;
    // returns the signal that ended it.
    int EndFakePlayer(int graceMs = 0)
    {
        if (fakePid <= 0)
            return 0;
        int status = 0;
        pid_t r = waitpid(fakePid, &status, WNOHANG);
        for (int waited = 0; r == 0 && waited < graceMs; waited += 10) {
            usleep(10000);
            r = waitpid(fakePid, &status, WNOHANG);
        }
        if (r == 0) {
            kill(fakePid, SIGKILL);
            waitpid(fakePid, &status, 0);
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
}

TEST_F(LocalPlayerTest, LoadfileEscapesBackslashesOnly)
{
    EXPECT_EQ("loadfile \"/m/a\\\\b.mp3\"", LocalPlayer::LoadFileCommand("/m/a\\b.mp3"));
    EXPECT_EQ("loadfile \"/m/say \"hi\".mp3\"", LocalPlayer::LoadFileCommand("/m/say \"hi\".mp3"));
    LocalPlayer player;
    Connect(player, {"/music/first.mp3", "/music/dir\\x \"y\".flac"});
    EXPECT_EQ(0, player.PlayIndex("1"));
    EXPECT_EQ("loadfile \"/music/dir\\\\x \"y\".flac\"", Received());
    EXPECT_EQ(0, player.PlayIndex("-4"));  // a negative index plays the first song
    EXPECT_EQ("loadfile \"/music/first.mp3\"", Received());
    EXPECT_EQ(0u, player.GetPlaylist()->Current());
    EXPECT_EQ(-1, player.PlayIndex("7"));
    EXPECT_NE(std::string::npos, Log().find("Failed to set index [7]"));
}

TEST_F(LocalPlayerTest, DeadOrBlockedPlayerNeverHangs)
{
    // Alive but no connection: not writable.
    StartFakePlayer();
    LocalPlayer player;
    EXPECT_EQ(-1, player.Mute());
    EXPECT_NE(std::string::npos, Log().find("MPlayer fd is not writable now"));

    // A player that reads nothing: fill the connection until it blocks.
    Connect(player);
    int fd = player.GetMplayerFd(), flags = fcntl(fd, F_GETFL);
    fcntl(fd, F_SETFL, flags | O_NONBLOCK);
    char junk[4096] = {0};
    while (write(fd, junk, sizeof(junk)) > 0) {
    }
    fcntl(fd, F_SETFL, flags);
    EXPECT_EQ(-1, player.SetVolume(20));
    EXPECT_EQ(-1, player.PlayPause());
    EXPECT_NE(std::string::npos, Log().find("Failed to send action [pause]"));

    // The peer has gone: the write fails, without SIGPIPE.
    signal(SIGPIPE, SIG_DFL);
    close(peer);
    peer = -1;
    EXPECT_EQ(-1, player.Mute());
    EXPECT_NE(std::string::npos, Log().find("Failed to send action to mplayer. fd="));
    signal(SIGPIPE, SIG_IGN);

    // The player process has ended: every command counts as sent.
    EndFakePlayer();
    LocalPlayer dead;
    Connect(dead);
    EndFakePlayer();
    EXPECT_EQ(0, dead.SetVolume(40));
    EXPECT_EQ(0, dead.Seek("10"));
    EXPECT_EQ("", Received());
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

TEST_F(LocalPlayerTest, PollAdvancesAtSongEndByRepeatMode)
{
    LocalPlayer player;
    Connect(player, {"/m/a.mp3", "/m/b.ogg"});
    EXPECT_EQ(-1, player.Poll(nullptr));
    EXPECT_NE(std::string::npos, Log().find("localplayer:336 Shared Memory is not attached."));
    player.GetPlaylist()->SetMode(2);
    snprintf(seg.currentUri, sizeof(seg.currentUri), "/m/a.mp3");
    seg.duration = 200;
    seg.position = 12;
    seg.state = 3;
    EXPECT_EQ(0, player.Poll(&seg));
    EXPECT_EQ(3u, player.GetState());
    Json::Value status;
    player.GetStatusJson(status);
    EXPECT_EQ("/m/a.mp3", status["CurrentUri"].asString());
    EXPECT_EQ(200, status["Duration"].asInt());
    EXPECT_EQ(12, status["Position"].asInt());
    EXPECT_EQ(50, status["Volume"].asInt());

    // Song ended in "Repeat One": the same song again, the field reads 2,
    // handled once.
    seg.state = 5;
    EXPECT_EQ(0, player.Poll(&seg));
    EXPECT_EQ(2, seg.state);
    EXPECT_EQ("loadfile \"/m/a.mp3\"", Received());
    EXPECT_EQ(0, player.Poll(&seg));
    EXPECT_EQ("", Received());
    // "Normal": the next song, then at the end the player stops.
    player.GetPlaylist()->SetMode(1);
    seg.state = 5;
    EXPECT_EQ(0, player.Poll(&seg));
    EXPECT_EQ("loadfile \"/m/b.ogg\"", Received());
    seg.state = 5;
    EXPECT_EQ(0, player.Poll(&seg));
    EXPECT_EQ("quit", Received());
    EXPECT_EQ(-1, player.GetMplayerFd());
}

TEST_F(LocalPlayerTest, PublishedSegment)
{
    LocalPlayer player;
    player.SetVolume(42);
    PublishedStatusShm pub;
    memset(&pub, 0xAB, sizeof(pub));
    pub.changed = 7;
    // Nothing reported yet: all zero but volume, changed and mode.
    player.GetPlaylist()->SetMode(3);
    EXPECT_EQ(0, player.PublishStatus(&pub));
    PublishedStatusShm expect;
    memset(&expect, 0, sizeof(expect));
    expect.volume = 42;
    expect.changed = 7;
    expect.repeatMode = 3;
    EXPECT_EQ(0, memcmp(&expect, &pub, sizeof(pub)));

    Connect(player);
    Add(player, "/m/a.mp3", "Alpha", "Band A");
    Add(player, "/m/sub/b.ogg", "", std::string(260, 'R'));
    player.GetPlaylist()->SetCurrent(1);
    snprintf(seg.currentUri, sizeof(seg.currentUri), "/m/sub/b.ogg");
    seg.duration = 180;
    seg.position = 61;
    seg.state = 3;
    player.Poll(&seg);
    EXPECT_EQ(0, player.PublishStatus(&pub));
    EXPECT_STREQ("/m/sub/b.ogg", pub.currentUri);
    EXPECT_EQ(180, pub.duration);
    EXPECT_EQ(61, pub.position);
    EXPECT_EQ(3, pub.state);
    EXPECT_EQ(1, pub.index);
    EXPECT_STREQ("b.ogg", pub.title);               // from the file name
    EXPECT_EQ(std::string(254, 'R'), pub.artist);   // cut, NUL-terminated

    // A radio stream: the stream title and the station name.
    snprintf(seg.radioStation, sizeof(seg.radioStation), "Tarn FM");
    snprintf(seg.streamTitle, sizeof(seg.streamTitle), "Live set");
    player.Poll(&seg);
    player.PublishStatus(&pub);
    EXPECT_STREQ("Live set", pub.title);
    EXPECT_STREQ("Tarn FM", pub.artist);
}

// The argument vector mplayer-daemon is started with, from the stored volume
// and the default equalizer profile.
TEST_F(LocalPlayerTest, StartArgumentsCarryVolumeAndEqualizer)
{
    std::string exe = TarnPath(TARN_MPLAYER_BIN), args = g_root + "/args.txt";
    WriteFile(exe, "#!/bin/sh\nfor a in \"$0\" \"$@\"; do echo \"$a\"; done > '" + args +
                       ".tmp'\necho END >> '" + args + ".tmp'\nmv '" + args + ".tmp' '" + args + "'\n");
    ASSERT_EQ(0, chmod(exe.c_str(), 0755));
    auto start = [&](LocalPlayer &player) {
        unlink(args.c_str());
        EXPECT_EQ(0, player.PlayPause());
        for (int i = 0; i < 200 && ReadFile(args).find("END") == std::string::npos; ++i)
            usleep(10000);
        return ReadFile(args);
    };
    LocalPlayer plain;
    EXPECT_EQ(-1, plain.PlayPause());  // empty queue
    Add(plain, "/m/a b.mp3");
    EXPECT_EQ(exe + "\n/m/a b.mp3\n-loop\n0\n-daemon\n-volume\n50\n-af\n"
                    "equalizer=0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0\nEND\n",
              start(plain));
    EXPECT_EQ(2u, plain.GetState());

    WriteFile(TarnPath(TARN_INFO_CONF),
              "audio_volume=\"35\"\naudio_enable_equalizer=yes\naudio_default_equalizer=Rock\n");
    WriteFile(TarnPath("/usr/tarn/etc.defaults/audio/equalizer.system"),
              "Pop:1.0 1.0 1.0 1.0 1.0 1.0 1.0 1.0 1.0 1.0\n"
              "Rock: 4.0 3.0 -1.0 -2.0 0.0 1.0 2.5 3.0 3.5 4.0 \n");
    LocalPlayer stored;
    Add(stored, "http://radio.example/x");
    std::string got = start(stored);
    EXPECT_NE(std::string::npos, got.find("\n-volume\n35\n")) << got;
    EXPECT_NE(std::string::npos, got.find("\nequalizer=4.0:3.0:-1.0:-2.0:0.0:1.0:2.5:3.0:3.5:4.0\n")) << got;
}

}  // namespace
