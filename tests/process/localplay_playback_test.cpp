// Local playback end to end: the real tarnaudiod starts the real
// mplayer-daemon, which plays generated tone songs into a WAV file
// (TARN_AUDIO_OUT=wav:PATH). What the WAV holds (tone frequencies and
// lengths, loudness) shows what was played and that commands took effect;
// the published segment and the status reply show what the daemon reports.
#include <gtest/gtest.h>

#include <json/json.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"
#include "tests/process/localplay_wav.h"

namespace {

using tarntest::Harness;
using tarntest::MakeMediaInfo;

const double kSongSeconds = 2.0;
const std::vector<double> kTones = {440.0, 660.0, 880.0};

std::string g_songDir;

bool WaitFor(const std::function<bool()> &pred, int timeoutMs)
{
    auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    while (std::chrono::steady_clock::now() < end) {
        if (pred())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return pred();
}

void SleepMs(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }

std::string Describe(const std::vector<localplay::Run> &runs)
{
    std::string s;
    for (const localplay::Run &r : runs) {
        char b[96];
        snprintf(b, sizeof(b), "[%s %.2fs@%.2f rms %.0f] ",
                 r.tone >= 0 ? std::to_string(int(kTones[r.tone])).c_str() : "silence",
                 r.length, r.start, r.rms);
        s += b;
    }
    return s;
}

class LocalPlaybackTest : public ::testing::Test {
protected:
    static void SetUpTestSuite()
    {
        char tmpl[] = "/tmp/localplay-songs.XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(tmpl));
        g_songDir = tmpl;
        std::string cmd = "sh '" + tarntest::SourcePath("scripts/make-demo-songs.sh") + "' '" +
                          g_songDir + "' 2 >/dev/null";
        ASSERT_EQ(0, system(cmd.c_str())) << cmd;
        // A longer song for the controls, as WAV so that it starts at once.
        cmd = "sox -q -n -r 44100 -c 2 -b 16 '" + g_songDir +
              "/long-440.wav' synth 30 sine 440 gain -6";
        ASSERT_EQ(0, system(cmd.c_str())) << cmd;
    }

    static void TearDownTestSuite()
    {
        std::string cmd = "rm -rf '" + g_songDir + "'";
        if (system(cmd.c_str()) != 0)
            fprintf(stderr, "could not remove %s\n", g_songDir.c_str());
    }

    void SetUp() override
    {
        ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
        ASSERT_EQ(0, access(tarntest::BinPath("mplayer-daemon").c_str(), X_OK))
            << "build the mplayer-daemon target first";
        h.reset(new Harness());
        wavPath = h->Root() + "/out.wav";
        setenv("TARN_AUDIO_OUT", ("wav:" + wavPath).c_str(), 1);
        ASSERT_EQ(0, h->Start()) << h->Error();
    }

    void TearDown() override
    {
        if (HasFailure() && h)
            fprintf(stderr, "--- daemon log ---\n%s\n", h->Log().c_str());
        h.reset();
    }

    std::string Song(const char *name) const { return g_songDir + "/" + name; }

    void AddSongs()
    {
        ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(Song("tone-440.mp3"), "Demo Tone A440",
                                               "Tarn Demo Band", 2.0f)));
        ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(Song("tone-660.flac"), "Demo Tone E660",
                                               "Tarn Demo Band", 2.0f)));
        ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(Song("tone-880.ogg"), "Demo Tone A880",
                                               "Tarn Demo Band", 2.0f)));
    }

    // Plays a song of the queue and waits for mplayer-daemon to connect.
    void PlayIndex(const char *index)
    {
        ASSERT_EQ(0, h->Request(ACT_PLAY_INDEX, index));
        ASSERT_TRUE(WaitFor([&] { return Status()["fdMplayer"].asInt() >= 0; }, 5000))
            << "mplayer-daemon did not connect";
    }

    Json::Value Status(int timeoutMs = 1000)
    {
        std::string text;
        Json::Value v;
        if (h->Request(ACT_GET_STATUS, nullptr, &text, timeoutMs) != 0)
            return v;
        Json::Reader().parse(text, v);
        return v;
    }

    // Playback has stopped: the daemon dropped the connection, and the
    // player process has ended (its pid file is gone).
    bool Stopped()
    {
        Json::Value s = Status();
        return s.isObject() && s["fdMplayer"].asInt() == -1 &&
               !h->Exists(TARN_MPLAYER_PID_FILE);
    }

    localplay::Wav LoadWav()
    {
        localplay::Wav wav;
        EXPECT_TRUE(localplay::LoadWav(wavPath, &wav)) << wavPath;
        return wav;
    }

    // Seconds of audio in the WAV output so far.
    double WavSeconds()
    {
        struct stat st;
        if (stat(wavPath.c_str(), &st) != 0 || st.st_size < 44)
            return 0.0;
        return double(st.st_size - 44) / (44100.0 * 4);
    }

    int MplayerPid() { return atoi(h->ReadFile(TARN_MPLAYER_PID_FILE).c_str()); }

    std::unique_ptr<Harness> h;
    std::string wavPath;
};

TEST_F(LocalPlaybackTest, QueuePlaysThroughAndEachSongFollows)
{
    AddSongs();
    PlayIndex("0");

    // Watch the published segment while the queue plays.
    std::vector<std::string> titles;
    bool sawArtist = false, sawPosition = false, sawPlaying = false;
    ASSERT_TRUE(WaitFor(
        [&] {
            const PublishedStatusShm *pub = h->PublishedSegment();
            if (pub && pub->currentUri[0]) {
                std::string t(pub->title, strnlen(pub->title, sizeof(pub->title)));
                if (titles.empty() || titles.back() != t)
                    titles.push_back(t);
                sawArtist = sawArtist || std::string(pub->artist) == "Tarn Demo Band";
                sawPosition = sawPosition || (pub->position >= 1 && pub->duration == 2);
                sawPlaying = sawPlaying || pub->state == PLAYER_STATE_PLAYING;
            }
            return Stopped();
        },
        20000))
        << "playback did not stop at the end of the queue";
    EXPECT_EQ((std::vector<std::string>{"Demo Tone A440", "Demo Tone E660", "Demo Tone A880"}),
              titles);
    EXPECT_TRUE(sawArtist);
    EXPECT_TRUE(sawPosition);
    EXPECT_TRUE(sawPlaying);
    EXPECT_EQ(0, Status()["PlayerState"].asInt());

    localplay::Wav wav = LoadWav();
    std::vector<localplay::Run> runs = localplay::ToneRuns(wav, kTones);
    ASSERT_EQ(3u, runs.size()) << Describe(runs);
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(i, runs[i].tone) << Describe(runs);
        EXPECT_NEAR(kSongSeconds, runs[i].length, 0.15) << Describe(runs);
    }
    // One song follows the next without a noticeable pause.
    for (int i = 0; i + 1 < 3; ++i) {
        double gap = runs[i + 1].start - (runs[i].start + runs[i].length);
        EXPECT_LT(gap, 0.5) << Describe(runs);
    }
}

TEST_F(LocalPlaybackTest, RepeatOnePlaysTheSameSongAgain)
{
    AddSongs();
    ASSERT_EQ(0, h->Request(ACT_SET_REPEAT_MODE, "2"));
    ASSERT_EQ(0, h->Request(ACT_PLAY_INDEX, "1"));
    ASSERT_TRUE(WaitFor([&] { return WavSeconds() >= 5.5; }, 15000));
    const PublishedStatusShm *pub = h->PublishedSegment();
    ASSERT_NE(nullptr, pub);
    EXPECT_EQ(1, pub->index);
    EXPECT_EQ(2, pub->repeatMode);
    ASSERT_EQ(0, h->Request(ACT_STOP, nullptr, nullptr, 3000));
    ASSERT_TRUE(WaitFor([&] { return Stopped(); }, 5000));

    std::vector<localplay::Run> runs = localplay::ToneRuns(LoadWav(), kTones);
    // Only the second song, at least twice over.
    double total = 0;
    for (const localplay::Run &r : runs) {
        EXPECT_EQ(1, r.tone) << Describe(runs);
        total += r.length;
    }
    EXPECT_GE(total, 2 * kSongSeconds + 0.5) << Describe(runs);
}

TEST_F(LocalPlaybackTest, RepeatAllWrapsToTheFirstSong)
{
    ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(Song("tone-880.ogg"), "A880", "B", 2.0f)));
    ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(Song("tone-660.flac"), "E660", "B", 2.0f)));
    ASSERT_EQ(0, h->Request(ACT_SET_REPEAT_MODE, "3"));
    ASSERT_EQ(0, h->Request(ACT_PLAY_INDEX, "0"));
    ASSERT_TRUE(WaitFor([&] { return WavSeconds() >= 4 * kSongSeconds + 0.8; }, 20000));
    ASSERT_EQ(0, h->Request(ACT_STOP, nullptr, nullptr, 3000));
    ASSERT_TRUE(WaitFor([&] { return Stopped(); }, 5000));

    std::vector<localplay::Run> runs = localplay::ToneRuns(LoadWav(), kTones);
    ASSERT_GE(runs.size(), 5u) << Describe(runs);
    const int expect[] = {2, 1, 2, 1, 2};
    for (int i = 0; i < 5; ++i)
        EXPECT_EQ(expect[i], runs[i].tone) << Describe(runs);
    for (int i = 0; i < 4; ++i)
        EXPECT_NEAR(kSongSeconds, runs[i].length, 0.15) << Describe(runs);
}

TEST_F(LocalPlaybackTest, UnsupportedSongsAreSkipped)
{
    ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(Song("tone-440.mp3"))));
    ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(Song("cover.jpg"))));
    ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(Song("tone-880.ogg"))));
    PlayIndex("0");
    ASSERT_TRUE(WaitFor([&] { return Stopped(); }, 15000));
    std::vector<localplay::Run> runs = localplay::ToneRuns(LoadWav(), kTones);
    ASSERT_EQ(2u, runs.size()) << Describe(runs);
    EXPECT_EQ(0, runs[0].tone);
    EXPECT_EQ(2, runs[1].tone);
}

TEST_F(LocalPlaybackTest, PauseSeekVolumeMuteAndEqualizerReachThePlayer)
{
    ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(Song("long-440.wav"), "Long", "Band", 30.0f)));
    ASSERT_EQ(0, h->Request(ACT_PLAY_INDEX, "0"));
    ASSERT_TRUE(WaitFor([&] { return Status()["Position"].asInt() >= 1; }, 10000));
    EXPECT_EQ(50, Status()["Volume"].asInt());

    // Pause: the player reports state 3 and the output stops growing.
    ASSERT_EQ(0, h->Request(ACT_PLAY_PAUSE));
    ASSERT_TRUE(WaitFor([&] { return Status()["PlayerState"].asInt() == 3; }, 3000));
    ASSERT_TRUE(WaitFor([&] { return h->PublishedSegment()->state == 3; }, 1000));
    double pausedAt = WavSeconds();
    SleepMs(1000);
    EXPECT_LT(WavSeconds() - pausedAt, 0.2);
    ASSERT_EQ(0, h->Request(ACT_PLAY_PAUSE));
    ASSERT_TRUE(WaitFor([&] { return Status()["PlayerState"].asInt() == 2; }, 3000));

    // Seek forward to 15 s.
    ASSERT_EQ(0, h->Request(ACT_SEEK, "15"));
    ASSERT_TRUE(WaitFor([&] { return Status()["Position"].asInt() >= 15; }, 3000))
        << Status().toStyledString();
    EXPECT_LT(Status()["Position"].asInt(), 19);

    // Volume 50 -> 20: quieter output.
    SleepMs(600);
    double t0 = WavSeconds();
    SleepMs(600);
    double t1 = WavSeconds();
    ASSERT_EQ(0, h->Request(ACT_SET_VOLUME, "20"));
    EXPECT_EQ(20, Status()["Volume"].asInt());
    SleepMs(500);
    double t2 = WavSeconds();
    SleepMs(600);
    double t3 = WavSeconds();

    // Mute: silence; mute again: sound.
    ASSERT_EQ(0, h->Request(ACT_MUTE));
    SleepMs(500);
    double t4 = WavSeconds();
    SleepMs(600);
    double t5 = WavSeconds();
    ASSERT_EQ(0, h->Request(ACT_MUTE));
    SleepMs(500);
    double t6 = WavSeconds();
    SleepMs(600);
    double t7 = WavSeconds();

    // Equalizer: every band down by 20 dB. The filter sits before the
    // player's output buffer, so the change is heard about a second later.
    ASSERT_EQ(0, h->Request(ACT_SET_EQUALIZER,
                            "-20.0 -20.0 -20.0 -20.0 -20.0 -20.0 -20.0 -20.0 -20.0 -20.0"));
    SleepMs(2000);
    double t8 = WavSeconds();
    SleepMs(600);
    double t9 = WavSeconds();

    ASSERT_EQ(0, h->Request(ACT_STOP, nullptr, nullptr, 3000));
    ASSERT_TRUE(WaitFor([&] { return Stopped(); }, 5000));

    localplay::Wav wav = LoadWav();
    double loud = localplay::RmsBetween(wav, t0, t1);
    double quiet = localplay::RmsBetween(wav, t2, t3);
    double muted = localplay::RmsBetween(wav, t4, t5);
    double unmuted = localplay::RmsBetween(wav, t6, t7);
    double equalized = localplay::RmsBetween(wav, t8, t9);
    char figures[200];
    snprintf(figures, sizeof(figures), "rms: vol50 %.0f vol20 %.0f muted %.0f unmuted %.0f eq %.0f",
             loud, quiet, muted, unmuted, equalized);
    EXPECT_GT(loud, 1000) << figures;
    EXPECT_LT(quiet, loud * 0.75) << figures;
    EXPECT_GT(quiet, loud * 0.05) << figures;
    EXPECT_LT(muted, 50) << figures;
    EXPECT_NEAR(quiet, unmuted, quiet * 0.2) << figures;
    EXPECT_LT(equalized, unmuted * 0.3) << figures;

    // The seek skipped audio: far less than 30 s were written.
    EXPECT_LT(wav.Seconds(), 20.0);
}

// A stopped (SIGSTOP) or killed (SIGKILL) player never holds the daemon up.
TEST_F(LocalPlaybackTest, HungOrKilledPlayerDoesNotBlockTheDaemon)
{
    ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(Song("long-440.wav"), "Long", "Band", 30.0f)));
    ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(Song("tone-660.flac"))));
    ASSERT_EQ(0, h->Request(ACT_PLAY_INDEX, "0"));
    ASSERT_TRUE(WaitFor([&] { return Status()["Position"].asInt() >= 1; }, 10000));
    int pid = MplayerPid();
    ASSERT_GT(pid, 0);

    ASSERT_EQ(0, kill(pid, SIGSTOP));
    // Enough padded commands to fill the connection many times over: each
    // is answered within a second.
    for (int i = 0; i < 300; ++i) {
        int action = (i % 3 == 0) ? ACT_SET_VOLUME : (i % 3 == 1) ? ACT_MUTE : ACT_SEEK;
        ASSERT_EQ(0, h->Request(action, "10", nullptr, 1000)) << "request " << i;
    }
    EXPECT_TRUE(h->WaitLog("MPlayer fd is not writable now", 2000));
    ASSERT_EQ(0, h->Request(ACT_NEXT, nullptr, nullptr, 1000));
    ASSERT_EQ(0, h->Request(ACT_PLAY_PAUSE, nullptr, nullptr, 1000));
    EXPECT_TRUE(Status(1000).isObject());

    // Killed while stopped: the daemon goes on answering; play starts a new
    // player process.
    ASSERT_EQ(0, kill(pid, SIGKILL));
    kill(pid, SIGCONT);
    ASSERT_TRUE(WaitFor([&] { h->Reap(); return kill(pid, 0) != 0; }, 3000));
    for (int action : {ACT_SET_VOLUME, ACT_MUTE, ACT_SEEK, ACT_NEXT, ACT_PREVIOUS}) {
        ASSERT_EQ(0, h->Request(action, "30", nullptr, 1000)) << "action " << action;
    }
    EXPECT_TRUE(Status(1000).isObject());
    ASSERT_EQ(0, h->Request(ACT_PLAY_INDEX, "1", nullptr, 1000));
    ASSERT_TRUE(WaitFor([&] { return MplayerPid() > 0 && MplayerPid() != pid; }, 5000));
    ASSERT_TRUE(WaitFor(
        [&] {
            const PublishedStatusShm *pub = h->PublishedSegment();
            return pub && std::string(pub->currentUri) == Song("tone-660.flac") &&
                   pub->state == PLAYER_STATE_PLAYING && pub->index == 1;
        },
        5000));
    ASSERT_TRUE(WaitFor([&] { return Stopped(); }, 10000));
}

}  // namespace
