// The real mplayer-daemon against a test-side command socket and player
// status segment: songs of several formats played into one WAV file, the
// commands while a song plays, the ways the process ends.
#include "tests/process/mplayer_process_util.h"

#include <gtest/gtest.h>

#include <chrono>
#include <string>

using namespace mptest;

namespace {

class MplayerDaemonTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        static int salt = 0;
        key_ = UniqueShmKey(++salt);
        ASSERT_TRUE(seg_.Create(key_)) << "shmget: " << strerror(errno);
        wav_ = root_.Path("/out.wav");
        pidFile_ = root_.Path("/var/run/mplayer.daemon.pid");
    }

    std::string Media(const std::string &name) const { return root_.Path("/media/" + name); }

    void Listen() { ASSERT_TRUE(sock_.Listen(root_.Path("/tmp/mplayer.sock"))); }

    // Starts the player on uri with the WAV output and takes its connection.
    void StartConnected(const std::string &uri, int volume = 100)
    {
        Listen();
        ASSERT_TRUE(player_.Start(root_, key_, "wav:" + wav_, uri, volume));
        ASSERT_TRUE(sock_.Accept(10000)) << "mplayer-daemon did not connect";
    }

    // Waits until the segment reports uri playing with a known duration.
    void ExpectPlaying(const std::string &uri, int duration)
    {
        EXPECT_TRUE(WaitFor([&] { return seg_.State() == PLAYER_STATE_PLAYING && seg_.Uri() == uri; },
                            5000))
            << "state " << seg_.State() << " uri [" << seg_.Uri() << "]";
        EXPECT_TRUE(WaitFor([&] { return seg_.Duration() == duration; }, 5000))
            << "duration " << seg_.Duration() << " for " << uri;
    }

    // Waits for the end of the song and answers like the daemon (2 back).
    void ExpectEndAndAck(int timeoutMs)
    {
        ASSERT_TRUE(WaitFor([&] { return seg_.State() == PLAYER_STATE_ENDED; }, timeoutMs))
            << "state " << seg_.State() << " position " << seg_.Position();
        seg_.SetState(PLAYER_STATE_PLAYING);
    }

    void ExpectCleanExit()
    {
        EXPECT_EQ(player_.WaitExit(8000), 0);
        EXPECT_NE(access(pidFile_.c_str(), F_OK), 0) << "pid file left behind";
    }

    TempRoot root_;
    int key_ = 0;
    PlayerSegment seg_;
    CommandSocket sock_;
    PlayerProcess player_;
    std::string wav_;
    std::string pidFile_;
};

TEST_F(MplayerDaemonTest, PlaysEveryFormatBackToBackIntoOneWav)
{
    struct Song {
        std::string file;
        std::string uri;  // as handed to mplayer-daemon
        double freq;
        int seconds;
        int rate;
        int channels;
    };
    std::vector<Song> songs = {
        {Media("tone a.mp3"), "", 440, 3, 44100, 2},
        {Media("tone\\b.flac"), "", 660, 2, 48000, 1},  // a backslash in the name
        {Media("tone \"c\".ogg"), "", 880, 2, 22050, 2},
        {Media("tone-d.m4a"), "", 550, 2, 44100, 2},
    };
    songs[0].uri = songs[0].file;
    songs[1].uri = songs[1].file;
    songs[2].uri = songs[2].file;
    songs[3].uri = "file://" + songs[3].file;
    for (const Song &s : songs)
        ASSERT_TRUE(MakeTone(s.file, s.freq, s.seconds, s.rate, s.channels)) << s.file;

    StartConnected(songs[0].uri);
    EXPECT_EQ(ReadFile(pidFile_), std::to_string(player_.Pid()) + "\n");
    for (size_t i = 0; i < songs.size(); ++i) {
        if (i > 0) {
            ASSERT_TRUE(sock_.Load(songs[i].uri));
        }
        ExpectPlaying(songs[i].uri, songs[i].seconds);
        if (i == 0) {
            // The position moves with the playing time.
            EXPECT_TRUE(WaitFor([&] { return seg_.Position() >= 1; }, 3000));
            EXPECT_TRUE(WaitFor([&] { return seg_.Position() >= 2; }, 3000));
        }
        ExpectEndAndAck(songs[i].seconds * 1000 + 5000);
        EXPECT_EQ(seg_.Position(), songs[i].seconds);
    }
    // After the last song it waits for the next loadfile.
    SleepMs(300);
    EXPECT_TRUE(player_.Alive());
    ASSERT_TRUE(sock_.Raw("quit"));
    ExpectCleanExit();

    Wav w = ReadWav(wav_);
    ASSERT_TRUE(w.ok) << w.why;
    EXPECT_EQ(w.rate, 44100);
    EXPECT_EQ(w.channels, 2);
    EXPECT_NEAR(w.Seconds(), 9.0, 0.3);
    double start = 0;
    for (const Song &s : songs) {
        EXPECT_NEAR(w.Frequency(start + 0.4, start + s.seconds - 0.4), s.freq, s.freq * 0.01)
            << s.file;
        EXPECT_GT(w.Rms(start + 0.4, start + s.seconds - 0.4), 0.2) << s.file;
        start += s.seconds;
    }
}

TEST_F(MplayerDaemonTest, PauseSeekVolumeMuteAndEqualizerWhilePlaying)
{
    // 3 s at 440 Hz, then 9 s at 880 Hz.
    std::string a = Media("a.wav"), b = Media("b.wav"), song = Media("song.flac");
    ASSERT_TRUE(MakeTone(a, 440, 3) && MakeTone(b, 880, 9) && Concat({a, b}, song));
    StartConnected(song);
    ExpectPlaying(song, 12);
    EXPECT_EQ(seg_.Volume(), 100);
    ASSERT_TRUE(WaitFor([&] { return seg_.Position() >= 1; }, 3000));

    // Relative seek by 3 s: from about 1 s into the 880 Hz part.
    int before = seg_.Position();
    double mSeek = WavSecondsNow(wav_);
    ASSERT_TRUE(sock_.Padded("seek 3"));
    EXPECT_TRUE(WaitFor([&] { return seg_.Position() >= before + 3; }, 2000))
        << "position " << seg_.Position() << " after seek from " << before;
    EXPECT_LE(seg_.Position(), before + 5);

    // Pause holds the position and the output; pause again resumes.
    SleepMs(500);
    ASSERT_TRUE(sock_.Raw("pause"));
    ASSERT_TRUE(WaitFor([&] { return seg_.State() == PLAYER_STATE_PAUSED; }, 1000));
    SleepMs(300);
    int pausedAt = seg_.Position();
    double wavPaused = WavSecondsNow(wav_);
    SleepMs(1000);
    EXPECT_EQ(seg_.Position(), pausedAt);
    EXPECT_LT(WavSecondsNow(wav_) - wavPaused, 0.05);
    ASSERT_TRUE(sock_.Raw("pause"));
    EXPECT_TRUE(WaitFor([&] { return seg_.State() == PLAYER_STATE_PLAYING; }, 1000));
    SleepMs(600);

    // Volume, mute on and off, equalizer down and flat again.
    double m1 = WavSecondsNow(wav_);
    ASSERT_TRUE(sock_.Padded("setvol 50"));
    SleepMs(900);
    double m2 = WavSecondsNow(wav_);
    ASSERT_TRUE(sock_.Padded("mute"));
    SleepMs(700);
    double m3 = WavSecondsNow(wav_);
    ASSERT_TRUE(sock_.Padded("mute"));
    SleepMs(700);
    double m4 = WavSecondsNow(wav_);
    ASSERT_TRUE(sock_.Padded("setequ -24.0 -24.0 -24.0 -24.0 -24.0 -24.0 -24.0 -24.0 -24.0 -24.0"));
    SleepMs(700);
    double m5 = WavSecondsNow(wav_);
    ASSERT_TRUE(sock_.Padded("setequ 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0"));
    SleepMs(700);
    double m6 = WavSecondsNow(wav_);
    EXPECT_EQ(seg_.Volume(), 50);

    ExpectEndAndAck(10000);
    ASSERT_TRUE(sock_.Raw("quit"));
    ExpectCleanExit();

    Wav w = ReadWav(wav_);
    ASSERT_TRUE(w.ok) << w.why;
    // 12 s of song less the 3 s skipped.
    EXPECT_NEAR(w.Seconds(), 9.0, 0.4);
    EXPECT_NEAR(w.Frequency(0.2, mSeek - 0.1), 440, 5);
    EXPECT_NEAR(w.Frequency(mSeek + 0.4, m1), 880, 9);
    const double settle = 0.2;  // the output's latency behind a command
    double full = w.Rms(m1 - 0.4, m1);
    ASSERT_GT(full, 0.2);
    EXPECT_NEAR(w.Rms(m1 + settle, m2) / full, 0.5, 0.05) << "setvol 50";
    EXPECT_LT(w.Rms(m2 + settle, m3), 0.001) << "mute";
    EXPECT_NEAR(w.Rms(m3 + settle, m4) / full, 0.5, 0.05) << "mute toggled off";
    EXPECT_LT(w.Rms(m4 + settle, m5) / full, 0.1) << "equalizer at -24 dB";
    EXPECT_NEAR(w.Rms(m5 + settle, m6) / full, 0.5, 0.05) << "equalizer flat";
}

TEST_F(MplayerDaemonTest, GarbageOnTheCommandStreamIsSkipped)
{
    std::string song = Media("long.ogg");
    ASSERT_TRUE(MakeTone(song, 440, 8));
    StartConnected(song);
    ExpectPlaying(song, 8);
    ASSERT_TRUE(sock_.SendBytes(std::string("\x01\x02junk 99 \xff\xfe", 13)));
    ASSERT_TRUE(sock_.Padded("setvol 30"));
    ASSERT_TRUE(sock_.SendBytes("more junk!"));
    ASSERT_TRUE(sock_.Raw("pause"));
    EXPECT_TRUE(WaitFor([&] { return seg_.State() == PLAYER_STATE_PAUSED && seg_.Volume() == 30; },
                        2000))
        << "state " << seg_.State() << " volume " << seg_.Volume();
    ASSERT_TRUE(sock_.Raw("quit"));
    ExpectCleanExit();
    EXPECT_NE(ReadFile(root_.Path("/log.txt")).find("not a command"), std::string::npos);
}

TEST_F(MplayerDaemonTest, SigtermCompletesTheWavFile)
{
    std::string song = Media("s.mp3");
    ASSERT_TRUE(MakeTone(song, 440, 10));
    StartConnected(song);
    ASSERT_TRUE(WaitFor([&] { return seg_.Position() >= 1; }, 5000));
    SleepMs(500);
    player_.Signal(SIGTERM);
    ExpectCleanExit();
    Wav w = ReadWav(wav_);
    ASSERT_TRUE(w.ok) << w.why;
    EXPECT_GT(w.Seconds(), 1.2);
    EXPECT_LT(w.Seconds(), 4.0);
    EXPECT_NEAR(w.Frequency(0.2, 1.2), 440, 5);
}

TEST_F(MplayerDaemonTest, SigtermDuringStartUpLeavesNoPidFile)
{
    std::string song = Media("s.flac");
    ASSERT_TRUE(MakeTone(song, 440, 5));
    Listen();
    // As soon as the pid file names it, the daemon may stop it.
    for (int i = 0; i < 5; ++i) {
        SCOPED_TRACE(i);
        PlayerProcess p;
        ASSERT_TRUE(p.Start(root_, key_, "wav:" + wav_, song));
        ASSERT_TRUE(WaitFor([&] { return access(pidFile_.c_str(), F_OK) == 0; }, 5000));
        p.Signal(SIGTERM);
        EXPECT_EQ(p.WaitExit(8000), 0);
        EXPECT_NE(access(pidFile_.c_str(), F_OK), 0) << "pid file left behind";
        unlink(pidFile_.c_str());
    }
}

// Without HOME the GStreamer registry is kept under the run root.
TEST_F(MplayerDaemonTest, StartsWithoutHome)
{
    std::string song = Media("s.flac");
    ASSERT_TRUE(MakeTone(song, 440, 1));
    Listen();
    player_.unsetVars = {"HOME", "GST_REGISTRY", "XDG_CACHE_HOME"};
    ASSERT_TRUE(player_.Start(root_, key_, "wav:" + wav_, song));
    ASSERT_TRUE(sock_.Accept(10000));
    ExpectEndAndAck(10000);
    EXPECT_EQ(access(root_.Path("/var/cache/mplayer-daemon/gst-registry.bin").c_str(), F_OK), 0);
    ASSERT_TRUE(sock_.Raw("quit"));
    ExpectCleanExit();
}

TEST_F(MplayerDaemonTest, ClosedConnectionEndsTheProcess)
{
    std::string song = Media("s.flac");
    ASSERT_TRUE(MakeTone(song, 440, 10));
    StartConnected(song);
    ExpectPlaying(song, 10);
    sock_.CloseClient();
    ExpectCleanExit();
    Wav w = ReadWav(wav_);
    EXPECT_TRUE(w.ok) << w.why;
}

TEST_F(MplayerDaemonTest, ConnectsWhenTheSocketAppearsLate)
{
    std::string song = Media("s.wav");
    ASSERT_TRUE(MakeTone(song, 440, 6));
    ASSERT_TRUE(player_.Start(root_, key_, "wav:" + wav_, song));
    // Plays and reports before anyone listens.
    ExpectPlaying(song, 6);
    ASSERT_TRUE(WaitFor([&] { return seg_.Position() >= 1; }, 3000));
    Listen();
    ASSERT_TRUE(sock_.Accept(6000)) << "no connection after the socket appeared";
    ASSERT_TRUE(sock_.Raw("quit"));
    ExpectCleanExit();
}

// Without a WAV file: "null" and "default" (this machine has no sound card:
// the default output falls back to a null output) still play in real time.
TEST_F(MplayerDaemonTest, PlaysInRealTimeWithoutDaemonOnOtherOutputs)
{
    std::string song = Media("s.ogg");
    ASSERT_TRUE(MakeTone(song, 440, 2));
    for (const char *out : {"null", "default"}) {
        SCOPED_TRACE(out);
        PlayerProcess p;
        seg_.SetState(0);
        auto t0 = std::chrono::steady_clock::now();
        ASSERT_TRUE(p.Start(root_, key_, out, song));
        ASSERT_TRUE(WaitFor([&] { return seg_.State() == PLAYER_STATE_ENDED; }, 10000))
            << "state " << seg_.State();
        double took = std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count();
        EXPECT_GT(took, 1.8) << "the song was not played in real time";
        EXPECT_EQ(seg_.Position(), 2);
        EXPECT_TRUE(p.Alive());
        p.Signal(SIGTERM);
        EXPECT_EQ(p.WaitExit(8000), 0);
    }
}

TEST_F(MplayerDaemonTest, UnplayableSongIsReportedAsEnded)
{
    std::string bad = Media("bad.mp3"), good = Media("good.flac");
    {
        FILE *f = fopen(bad.c_str(), "wb");
        ASSERT_TRUE(f);
        for (int i = 0; i < 20000; ++i)
            fputc((i * 7919) & 0xff, f);
        fclose(f);
    }
    ASSERT_TRUE(MakeTone(good, 440, 2));
    StartConnected(bad);
    ExpectEndAndAck(8000);
    EXPECT_EQ(seg_.Uri(), bad);
    ASSERT_TRUE(sock_.Load(Media("missing.mp3")));
    ExpectEndAndAck(8000);
    ASSERT_TRUE(sock_.Load("http://127.0.0.1:1/station"));  // nobody listens there
    ExpectEndAndAck(8000);
    ASSERT_TRUE(sock_.Load(good));
    ExpectPlaying(good, 2);
    ExpectEndAndAck(8000);
    ASSERT_TRUE(sock_.Raw("quit"));
    ExpectCleanExit();
    std::string log = ReadFile(root_.Path("/log.txt"));
    EXPECT_NE(log.find("Failed to play [" + bad + "]"), std::string::npos) << log;
    EXPECT_NE(log.find("missing.mp3"), std::string::npos) << log;
    EXPECT_NE(log.find("127.0.0.1:1/station"), std::string::npos) << log;
}

}  // namespace
