// LocalPlayer against a stand-in for mplayer-daemon: one end of a socketpair
// is the player's connection, the test reads the other end; a child process
// of the test is the "living player" named by the pid file. Covers the two
// command framings, the loadfile escaping, queue stepping, the poll, the
// published segment and the start of mplayer-daemon (a script that records
// its arguments stands in for the executable).
#include <gtest/gtest.h>

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>

#include <sys/soundcard.h>

#include "audio/info.h"
#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"
#include "player/localplayer.h"
#include "player/playlist.h"

namespace {

// Every fixed path of this process lies under one temporary root, set before
// anything asks for it.
std::string MakeRoot()
{
    char tmpl[] = "/tmp/localplayer-unit.XXXXXX";
    const char *dir = mkdtemp(tmpl);
    if (!dir)
        abort();
    std::string root = dir;
    setenv("TARN_ROOT", root.c_str(), 1);
    setenv("TARN_LOG_FILE", (root + "/log.txt").c_str(), 1);
    return root;
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
    std::string cmd = "mkdir -p \"$(dirname '" + path + "')\"";
    ASSERT_EQ(0, system(cmd.c_str()));
    std::ofstream out(path);
    out << text;
}

std::string Log() { return ReadFile(g_root + "/log.txt"); }

TARN_MEDIA_INFO Song(const std::string &path, const std::string &title = "",
                     const std::string &artist = "")
{
    TARN_MEDIA_INFO info;
    memset(&info, 0, sizeof(info));
    snprintf(info.path, sizeof(info.path), "%s", path.c_str());
    snprintf(info.title, sizeof(info.title), "%s", title.c_str());
    snprintf(info.artist, sizeof(info.artist), "%s", artist.c_str());
    return info;
}

class LocalPlayerTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        signal(SIGPIPE, SIG_IGN);
        // A clean root: no stored volume, no equalizer, no pid file.
        std::string cmd = "rm -rf '" + g_root + "'/* && mkdir -p '" + g_root +
                          "/var/run' '" + g_root + "/etc' '" + g_root + "/usr/tarn/bin'";
        ASSERT_EQ(0, system(cmd.c_str()));
        segment.reset(new PlayerStatusShm());
        memset(segment.get(), 0, sizeof(PlayerStatusShm));
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
        if (fakePid == 0) {
            for (;;)
                pause();
        }
        WriteFile(TarnPath(TARN_MPLAYER_PID_FILE), std::to_string(fakePid) + "\n");
    }

    // Ends the fake player, after waiting up to graceMs for a signal already
    // sent to arrive; returns the signal that ended it (0 if none started).
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

    // Connects the player to a socketpair; the test keeps the other end.
    void Connect(LocalPlayer &player)
    {
        int sv[2];
        ASSERT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM, 0, sv));
        ASSERT_EQ(0, player.AttachMplayerFd(sv[0]));
        peer = sv[1];
    }

    // Everything the player has written so far.
    std::string Received()
    {
        std::string out;
        char buf[8192];
        struct pollfd p = {peer, POLLIN, 0};
        while (poll(&p, 1, 50) > 0) {
            ssize_t n = recv(peer, buf, sizeof(buf), MSG_DONTWAIT);
            if (n <= 0)
                break;
            out.append(buf, static_cast<size_t>(n));
        }
        return out;
    }

    static std::string Padded(const std::string &text)
    {
        std::string s = text;
        s.resize(2048, '\0');
        return s;
    }

    std::unique_ptr<PlayerStatusShm> segment;
    pid_t fakePid = -1;
    int peer = -1;
};

TEST_F(LocalPlayerTest, RawAndPaddedFramings)
{
    StartFakePlayer();
    LocalPlayer player;
    Connect(player);

    // Raw, no terminator.
    EXPECT_EQ(0, player.PlayPause());
    EXPECT_EQ("pause", Received());

    // The seek offset is relative to the last reported position.
    segment->position = 30;
    ASSERT_EQ(0, player.Poll(segment.get()));
    EXPECT_EQ(0, player.Seek("100"));
    EXPECT_EQ(Padded("seek 70"), Received());
    EXPECT_EQ(0, player.Seek("-5"));
    EXPECT_EQ(Padded("seek -30"), Received());

    EXPECT_EQ(0, player.SetVolume(150));
    EXPECT_EQ(100, player.GetVolume());
    EXPECT_EQ(Padded("setvol 100"), Received());

    EXPECT_EQ(0, player.Mute());
    EXPECT_EQ(Padded("mute"), Received());

    const char gains[] = "1.0 2.0 3.0 4.0 5.0 -5.0 -4.0 -3.0 -2.0 -1.0";
    EXPECT_EQ(0, player.SetEqualizer(gains));
    EXPECT_EQ(Padded(std::string("setequ ") + gains), Received());
}

TEST_F(LocalPlayerTest, VolumeActionsClampAndStepByThree)
{
    StartFakePlayer();
    LocalPlayer player;
    Connect(player);
    Json::Value reply;

    ControlRequest req;
    memset(&req, 0, sizeof(req));
    req.action = ACT_SET_VOLUME;
    snprintf(req.parameter, sizeof(req.parameter), "2");
    EXPECT_EQ(0, player.HandleAction(&req, reply));
    req.action = ACT_VOLUME_DOWN;
    EXPECT_EQ(0, player.HandleAction(&req, reply));
    EXPECT_EQ(0, player.GetVolume());
    req.action = ACT_VOLUME_UP;
    EXPECT_EQ(0, player.HandleAction(&req, reply));
    EXPECT_EQ(3, player.GetVolume());
    EXPECT_EQ(Padded("setvol 2") + Padded("setvol 0") + Padded("setvol 3"), Received());
}

TEST_F(LocalPlayerTest, LoadfileEscapesBackslashesOnly)
{
    EXPECT_EQ("loadfile \"/m/a\\\\b.mp3\"", LocalPlayer::LoadFileCommand("/m/a\\b.mp3"));
    EXPECT_EQ("loadfile \"/m/say \"hi\".mp3\"", LocalPlayer::LoadFileCommand("/m/say \"hi\".mp3"));

    StartFakePlayer();
    LocalPlayer player;
    Connect(player);
    TARN_MEDIA_INFO a = Song("/music/first.mp3");
    TARN_MEDIA_INFO b = Song("/music/dir\\x \"y\".flac");
    ASSERT_EQ(0, player.GetPlaylist()->AddSong(&a));
    ASSERT_EQ(0, player.GetPlaylist()->AddSong(&b));

    EXPECT_EQ(0, player.PlayIndex("1"));
    EXPECT_EQ("loadfile \"/music/dir\\\\x \"y\".flac\"", Received());
    EXPECT_EQ(1u, player.GetPlaylist()->Current());

    // A negative index plays the first song.
    EXPECT_EQ(0, player.PlayIndex("-4"));
    EXPECT_EQ("loadfile \"/music/first.mp3\"", Received());
    EXPECT_EQ(0u, player.GetPlaylist()->Current());

    EXPECT_EQ(-1, player.PlayIndex("7"));
    EXPECT_NE(std::string::npos, Log().find("localplayer:"));
    EXPECT_NE(std::string::npos, Log().find("Failed to set index [7]"));
}

TEST_F(LocalPlayerTest, DeadPlayerDropsCommandsAsSent)
{
    LocalPlayer player;
    Connect(player);
    // No pid file: nothing is alive, every command counts as sent.
    EXPECT_EQ(0, player.Mute());
    EXPECT_EQ(0, player.SetVolume(40));
    EXPECT_EQ(0, player.Seek("10"));
    EXPECT_EQ("", Received());

    // A stale pid file (a process that has ended) is the same.
    StartFakePlayer();
    EndFakePlayer();
    TARN_MEDIA_INFO a = Song("/m/a.mp3"), b = Song("/m/b.mp3");
    player.GetPlaylist()->AddSong(&a);
    player.GetPlaylist()->AddSong(&b);
    EXPECT_EQ(0, player.Next(false));
    EXPECT_EQ(0u, player.GetPlaylist()->Current());
    EXPECT_EQ(0, player.Previous());
    EXPECT_EQ("", Received());
}

TEST_F(LocalPlayerTest, UnwritableOrClosedConnectionFails)
{
    StartFakePlayer();
    LocalPlayer player;
    // Alive but no connection: not writable.
    EXPECT_EQ(-1, player.Mute());
    EXPECT_NE(std::string::npos, Log().find("MPlayer fd is not writable now"));

    // A player that reads nothing: fill the connection until it blocks.
    Connect(player);
    int fd = player.GetMplayerFd();
    int flags = fcntl(fd, F_GETFL);
    fcntl(fd, F_SETFL, flags | O_NONBLOCK);
    char junk[4096] = {0};
    while (write(fd, junk, sizeof(junk)) > 0) {
    }
    fcntl(fd, F_SETFL, flags);
    WriteFile(g_root + "/log.txt", "");
    EXPECT_EQ(-1, player.SetVolume(20));
    EXPECT_EQ(-1, player.PlayPause());
    std::string log = Log();
    EXPECT_NE(std::string::npos, log.find("MPlayer fd is not writable now"));
    EXPECT_NE(std::string::npos, log.find("Failed to send action play."));
    EXPECT_NE(std::string::npos, log.find("Failed to send action [pause]"));

    // The peer has gone: the write fails, without SIGPIPE.
    signal(SIGPIPE, SIG_DFL);
    close(peer);
    peer = -1;
    WriteFile(g_root + "/log.txt", "");
    EXPECT_EQ(-1, player.Mute());
    EXPECT_NE(std::string::npos, Log().find("Failed to send action to mplayer. fd="));
    signal(SIGPIPE, SIG_IGN);
}

TEST_F(LocalPlayerTest, NextAndPreviousSkipUnsupportedSongs)
{
    StartFakePlayer();
    LocalPlayer player;
    Connect(player);
    Playlist *q = player.GetPlaylist();
    const char *paths[] = {"/m/a.mp3", "/m/notes.txt", "/m/noext", "/m/c.FLAC",
                           "http://radio.example/stream"};
    for (const char *p : paths) {
        TARN_MEDIA_INFO s = Song(p);
        q->AddSong(&s);
    }
    EXPECT_EQ(0, player.Next(false));
    EXPECT_EQ("loadfile \"/m/c.FLAC\"", Received());
    EXPECT_EQ(3u, q->Current());
    EXPECT_EQ(0, player.Next(false));
    EXPECT_EQ("loadfile \"http://radio.example/stream\"", Received());
    EXPECT_EQ(0, player.Previous());
    EXPECT_EQ("loadfile \"/m/c.FLAC\"", Received());
    EXPECT_EQ(0, player.Previous());
    EXPECT_EQ("loadfile \"/m/a.mp3\"", Received());
    EXPECT_EQ(0u, q->Current());
}

TEST_F(LocalPlayerTest, EndOfNormalQueueStopsThePlayer)
{
    StartFakePlayer();
    LocalPlayer player;
    Connect(player);
    TARN_MEDIA_INFO a = Song("/m/a.mp3"), b = Song("/m/b.txt");
    player.GetPlaylist()->AddSong(&a);
    player.GetPlaylist()->AddSong(&b);

    // Only unsupported songs remain: Next stops the player. The fake player
    // ignores "quit", so it is ended with SIGTERM after the wait.
    EXPECT_EQ(-1, player.Next(false));
    EXPECT_EQ("quit", Received());
    EXPECT_EQ(-1, player.GetMplayerFd());
    EXPECT_EQ(0u, player.GetState());
    EXPECT_EQ(SIGTERM, EndFakePlayer(2000));
}

TEST_F(LocalPlayerTest, RepeatAllOfUnsupportedSongsEndsAfterOneRound)
{
    StartFakePlayer();
    LocalPlayer player;
    Connect(player);
    const char *paths[] = {"/m/x.txt", "/m/y.doc", "/m/z"};
    for (const char *p : paths) {
        TARN_MEDIA_INFO s = Song(p);
        player.GetPlaylist()->AddSong(&s);
    }
    player.GetPlaylist()->SetMode(3);
    EXPECT_EQ(-1, player.Next(false));
    EXPECT_EQ("quit", Received());
    EXPECT_EQ(0u, player.GetPlaylist()->Current());
}

TEST_F(LocalPlayerTest, PollCopiesReportsAndAdvancesAtSongEnd)
{
    StartFakePlayer();
    LocalPlayer player;
    // Without a connection nothing is read.
    snprintf(segment->currentUri, sizeof(segment->currentUri), "/m/a.mp3");
    segment->state = 3;
    EXPECT_EQ(0, player.Poll(segment.get()));
    EXPECT_EQ("", player.GetCurrentUri());
    EXPECT_EQ(0u, player.GetState());

    Connect(player);
    EXPECT_EQ(-1, player.Poll(nullptr));
    EXPECT_NE(std::string::npos, Log().find("localplayer:336 Shared Memory is not attached."));

    TARN_MEDIA_INFO a = Song("/m/a.mp3"), b = Song("/m/b.ogg");
    player.GetPlaylist()->AddSong(&a);
    player.GetPlaylist()->AddSong(&b);
    player.GetPlaylist()->SetMode(2);

    // State 0: texts and numbers are copied, the state is not.
    segment->state = 0;
    segment->duration = 200;
    segment->position = 12;
    snprintf(segment->radioStation, sizeof(segment->radioStation), "Station");
    snprintf(segment->streamTitle, sizeof(segment->streamTitle), "Now on air");
    EXPECT_EQ(0, player.Poll(segment.get()));
    EXPECT_EQ(0u, player.GetState());
    EXPECT_EQ("/m/a.mp3", player.GetCurrentUri());
    EXPECT_EQ(12, player.GetPosition());
    Json::Value status;
    player.GetStatusJson(status);
    EXPECT_EQ(200, status["Duration"].asInt());
    EXPECT_EQ("Station", status["RadioStation"].asString());
    EXPECT_EQ("Now on air", status["StreamTitle"].asString());
    EXPECT_EQ(player.GetMplayerFd(), status["fdMplayer"].asInt());
    EXPECT_EQ(50, status["Volume"].asInt());
    EXPECT_EQ(0, status["PlayerState"].asInt());

    segment->state = 3;
    EXPECT_EQ(0, player.Poll(segment.get()));
    EXPECT_EQ(3u, player.GetState());

    // Song ended in "Repeat One": the same song again, the field reads 2.
    segment->state = 5;
    EXPECT_EQ(0, player.Poll(segment.get()));
    EXPECT_EQ(2, segment->state);
    EXPECT_EQ(5u, player.GetState());
    EXPECT_EQ("loadfile \"/m/a.mp3\"", Received());
    // Handled once.
    EXPECT_EQ(0, player.Poll(segment.get()));
    EXPECT_EQ("", Received());

    // "Normal": the next song, then at the end the player stops.
    player.GetPlaylist()->SetMode(1);
    segment->state = 5;
    EXPECT_EQ(0, player.Poll(segment.get()));
    EXPECT_EQ("loadfile \"/m/b.ogg\"", Received());
    segment->state = 5;
    EXPECT_EQ(0, player.Poll(segment.get()));
    EXPECT_EQ("quit", Received());
    EXPECT_EQ(-1, player.GetMplayerFd());
}

TEST_F(LocalPlayerTest, PublishedSegment)
{
    StartFakePlayer();
    LocalPlayer player;
    player.SetVolume(42);
    PublishedStatusShm pub;
    memset(&pub, 0xAB, sizeof(pub));
    pub.changed = 7;

    // Nothing reported yet: all zero but volume, changed, shuffle and mode.
    player.GetPlaylist()->SetMode(3);
    EXPECT_EQ(0, player.PublishStatus(&pub));
    PublishedStatusShm expect;
    memset(&expect, 0, sizeof(expect));
    expect.volume = 42;
    expect.changed = 7;
    expect.shuffle = 0;
    expect.repeatMode = 3;
    EXPECT_EQ(0, memcmp(&expect, &pub, sizeof(pub)));

    std::string longTitle(300, 'T');
    TARN_MEDIA_INFO a = Song("/m/a.mp3", "Alpha", "Band A");
    TARN_MEDIA_INFO b = Song("/m/sub/b.ogg", "", std::string(260, 'R'));
    TARN_MEDIA_INFO c = Song("/m/c.flac", longTitle.substr(0, 254), "C");
    player.GetPlaylist()->AddSong(&a);
    player.GetPlaylist()->AddSong(&b);
    player.GetPlaylist()->AddSong(&c);
    player.GetPlaylist()->SetCurrent(1);
    player.GetPlaylist()->ToggleShuffle();

    Connect(player);
    snprintf(segment->currentUri, sizeof(segment->currentUri), "/m/sub/b.ogg");
    segment->duration = 180;
    segment->position = 61;
    segment->state = 3;
    player.Poll(segment.get());
    EXPECT_EQ(0, player.PublishStatus(&pub));
    EXPECT_STREQ("/m/sub/b.ogg", pub.currentUri);
    EXPECT_EQ(180, pub.duration);
    EXPECT_EQ(61, pub.position);
    EXPECT_EQ(3, pub.state);
    EXPECT_EQ(1, pub.index);
    EXPECT_EQ(1, pub.shuffle);
    EXPECT_EQ(42, pub.volume);
    EXPECT_EQ(7, pub.changed);
    EXPECT_STREQ("b.ogg", pub.title);               // from the file name
    EXPECT_EQ(std::string(254, 'R'), pub.artist);   // cut, NUL-terminated

    // A radio stream: the stream title and the station name.
    snprintf(segment->radioStation, sizeof(segment->radioStation), "Tarn FM");
    snprintf(segment->streamTitle, sizeof(segment->streamTitle), "Live set");
    player.Poll(segment.get());
    player.PublishStatus(&pub);
    EXPECT_STREQ("Live set", pub.title);
    EXPECT_STREQ("Tarn FM", pub.artist);

    EXPECT_EQ(-1, player.PublishStatus(nullptr));
}

TEST_F(LocalPlayerTest, HandleActionDispatch)
{
    LocalPlayer player;
    Json::Value reply;
    EXPECT_EQ(-1, player.HandleAction(nullptr, reply));
    EXPECT_NE(std::string::npos, Log().find("Bad parameter"));

    ControlRequest req;
    memset(&req, 0, sizeof(req));
    req.action = ACT_SEARCH_SERVERS;
    EXPECT_EQ(-1, player.HandleAction(&req, reply));
    EXPECT_NE(std::string::npos, Log().find("Action [14] not handled"));

    // Queue actions reach the queue; a failing action still answers 0.
    TARN_MEDIA_INFO a = Song("/m/a.mp3", "Alpha");
    req.action = ACT_QUEUE_ADD;
    memcpy(req.parameter, &a, sizeof(a));
    EXPECT_EQ(0, player.HandleAction(&req, reply));
    EXPECT_EQ(1u, player.GetPlaylist()->Count());
    memset(&req, 0, sizeof(req));
    req.action = ACT_QUEUE_LIST;
    reply = Json::Value();
    EXPECT_EQ(0, player.HandleAction(&req, reply));
    EXPECT_EQ(1, reply["total"].asInt());
    req.action = ACT_PLAY_INDEX;
    snprintf(req.parameter, sizeof(req.parameter), "9");
    EXPECT_EQ(0, player.HandleAction(&req, reply));

    req.action = ACT_GET_STATUS;
    reply = Json::Value();
    EXPECT_EQ(0, player.HandleAction(&req, reply));
    for (const char *key : {"PlayerState", "fdMplayer", "CurrentUri", "Duration", "Position",
                            "StreamTitle", "RadioStation", "Volume"})
        EXPECT_TRUE(reply.isMember(key)) << key;
    EXPECT_EQ(-1, reply["Duration"].asInt());
    EXPECT_EQ(-1, reply["fdMplayer"].asInt());
}

// The argument vector mplayer-daemon is started with, recorded by a script
// standing in for the executable.
class StartMplayerTest : public LocalPlayerTest {
protected:
    std::string StartAndReadArgs(LocalPlayer &player)
    {
        std::string args = g_root + "/args.txt";
        unlink(args.c_str());
        EXPECT_EQ(0, player.PlayPause());
        for (int i = 0; i < 200 && ReadFile(args).find("END") == std::string::npos; ++i)
            usleep(10000);
        return ReadFile(args);
    }

    void InstallScript()
    {
        std::string exe = TarnPath(TARN_MPLAYER_BIN);
        WriteFile(exe, "#!/bin/sh\nfor a in \"$0\" \"$@\"; do echo \"$a\"; done > '" + g_root +
                           "/args.tmp'\necho END >> '" + g_root + "/args.tmp'\nmv '" + g_root +
                           "/args.tmp' '" + g_root + "/args.txt'\n");
        ASSERT_EQ(0, chmod(exe.c_str(), 0755));
    }
};

TEST_F(StartMplayerTest, DefaultVolumeAndNeutralEqualizer)
{
    InstallScript();
    LocalPlayer player;
    EXPECT_EQ(-1, player.PlayPause());   // empty queue
    EXPECT_NE(std::string::npos, Log().find("Failed to get current song in playlist."));

    TARN_MEDIA_INFO a = Song("/m/a b.mp3");
    player.GetPlaylist()->AddSong(&a);
    std::string exe = TarnPath(TARN_MPLAYER_BIN);
    EXPECT_EQ(exe + "\n/m/a b.mp3\n-loop\n0\n-daemon\n-volume\n50\n-af\n"
                    "equalizer=0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0\nEND\n",
              StartAndReadArgs(player));
    EXPECT_EQ(2u, player.GetState());
}

TEST_F(StartMplayerTest, StoredVolumeAndDefaultEqualizerProfile)
{
    InstallScript();
    WriteFile(TarnPath(TARN_INFO_CONF),
              "audio_volume=\"35\"\naudio_enable_equalizer=yes\naudio_default_equalizer=Rock\n");
    WriteFile(TarnPath("/usr/tarn/etc.defaults/audio/equalizer.system"),
              "Pop:1.0 1.0 1.0 1.0 1.0 1.0 1.0 1.0 1.0 1.0\n"
              "Rock: 4.0 3.0 -1.0 -2.0 0.0 1.0 2.5 3.0 3.5 4.0 \n");
    LocalPlayer player;
    EXPECT_EQ(35, player.GetVolume());
    TARN_MEDIA_INFO a = Song("http://radio.example/x");
    player.GetPlaylist()->AddSong(&a);
    std::string args = StartAndReadArgs(player);
    EXPECT_NE(std::string::npos, args.find("\n-volume\n35\n")) << args;
    EXPECT_NE(std::string::npos,
              args.find("\nequalizer=4.0:3.0:-1.0:-2.0:0.0:1.0:2.5:3.0:3.5:4.0\n"))
        << args;
}

TEST_F(StartMplayerTest, MissingExecutableFails)
{
    LocalPlayer player;
    TARN_MEDIA_INFO a = Song("/m/a.mp3");
    player.GetPlaylist()->AddSong(&a);
    EXPECT_EQ(-1, player.PlayIndex("0"));
    EXPECT_EQ(0u, player.GetState());
    std::string log = Log();
    EXPECT_NE(std::string::npos, log.find("Failed to start MPlayer"));
    EXPECT_NE(std::string::npos, log.find("Failed to Start MPlayer with uri [/m/a.mp3]"));
    EXPECT_NE(std::string::npos, log.find("Failed to Start Mplayer"));
}

TEST_F(LocalPlayerTest, SaveVolumeAndKillStoresVolumeAndEndsPlayer)
{
    StartFakePlayer();
    {
        LocalPlayer player;
        Connect(player);
        player.SetVolume(77);
        player.SaveVolumeAndKill();
        EXPECT_EQ(-1, player.GetMplayerFd());
    }
    EXPECT_EQ(SIGTERM, EndFakePlayer(2000));
    EXPECT_NE(std::string::npos,
              ReadFile(TarnPath(TARN_INFO_CONF)).find("audio_volume=\"77\""));
    LocalPlayer again;
    EXPECT_EQ(77, again.GetVolume());
}

// A sound card with one mixer ("/dev/mixer" under the root) and a PCM
// channel: records what is written, reads back a set level.
int g_mixerLevel = 0;          // value MIXER_READ returns
int g_mixerWritten = -1;       // last value of MIXER_WRITE
int FakeOpen(const char *path, int)
{
    return TarnPath("/dev/mixer") == path ? 1000 : -1;
}
int FakeIoctl(int, unsigned long request, void *arg)
{
    int *value = static_cast<int *>(arg);
    if (request == static_cast<unsigned long>(SOUND_MIXER_READ_DEVMASK)) {
        *value = SOUND_MASK_PCM;
        return 0;
    }
    if (request == static_cast<unsigned long>(MIXER_READ(SOUND_MIXER_PCM))) {
        *value = g_mixerLevel;
        return 0;
    }
    if (request == static_cast<unsigned long>(MIXER_WRITE(SOUND_MIXER_PCM))) {
        g_mixerWritten = *value;
        return 0;
    }
    return -1;
}
int FakeClose(int) { return 0; }

TEST_F(LocalPlayerTest, MixerIsSetAndReReadEverySixSeconds)
{
    MixerOps ops = {FakeOpen, FakeIoctl, FakeClose};
    MixerSetOps(&ops);
    StartFakePlayer();
    LocalPlayer player;
    Connect(player);

    EXPECT_EQ(0, player.SetVolume(30));
    EXPECT_EQ(30 * 256 + 30, g_mixerWritten);

    // Changed outside the daemon: left 80, right 81.
    g_mixerLevel = 81 * 256 + 80;
    segment->state = 2;
    player.Poll(segment.get());
    EXPECT_EQ(30, player.GetVolume());   // too early
    sleep(6);
    segment->state = 0;                  // no news: the volume is not read
    player.Poll(segment.get());
    EXPECT_EQ(30, player.GetVolume());
    segment->state = 2;
    player.Poll(segment.get());
    EXPECT_EQ(80, player.GetVolume());
    // Read once per six seconds.
    g_mixerLevel = 10 * 256 + 10;
    player.Poll(segment.get());
    EXPECT_EQ(80, player.GetVolume());
    MixerSetOps(nullptr);
}

}  // namespace
