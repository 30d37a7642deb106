// Local playback end to end: the real tarnaudiod starts the real
// mplayer-daemon, which plays generated tone songs into a WAV file. The WAV
// shows what was played and that commands took effect; the published segment
// and the status reply show what the daemon reports.
#include <gtest/gtest.h>

#include <json/json.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"
#include "tests/process/localplay_wav.h"

namespace {

using tarntest::MakeMediaInfo;
const std::vector<double> kTones = {440.0, 660.0, 880.0};
std::string g_songDir;

bool WaitFor(const std::function<bool()> &pred, int timeoutMs)
{
    auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    for (;;) {
        if (pred())
            return true;
        if (std::chrono::steady_clock::now() >= end)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
}
void SleepMs(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }

std::string Describe(const std::vector<localplay::Run> &runs)
{
    std::string s;
    for (const localplay::Run &r : runs)
        s += "[" + std::to_string(int(kTones[r.tone])) + " " + std::to_string(r.length) + "s@" +
             std::to_string(r.start) + "] ";
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
                          g_songDir + "' 2 >/dev/null && sox -q -n -r 44100 -c 2 -b 16 '" +
                          g_songDir + "/long-440.wav' synth 30 sine 440 gain -6";
        ASSERT_EQ(0, system(cmd.c_str())) << cmd;
    }
    static void TearDownTestSuite()
    {
        if (system(("rm -rf '" + g_songDir + "'").c_str()) != 0)
            fprintf(stderr, "could not remove %s\n", g_songDir.c_str());
    }
    void SetUp() override
    {
        ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
        ASSERT_EQ(0, access(tarntest::BinPath("mplayer-daemon").c_str(), X_OK))
            << "build the mplayer-daemon target first";
        wavPath = h.Root() + "/out.wav";
        setenv("TARN_AUDIO_OUT", ("wav:" + wavPath).c_str(), 1);
        ASSERT_EQ(0, h.Start()) << h.Error();
    }
    void TearDown() override
    {
        if (HasFailure())
            fprintf(stderr, "--- daemon log ---\n%s\n", h.Log().c_str());
    }

    std::string Song(const char *name) const { return g_songDir + "/" + name; }
    void Add(const char *file, const char *title = "", float seconds = 2.0f)
    {
        ASSERT_EQ(0, h.QueueAdd(MakeMediaInfo(Song(file), title, "Tarn Demo Band", seconds)));
    }
    Json::Value Status()
    {
        std::string text;
        Json::Value v;
        if (h.Request(ACT_GET_STATUS, nullptr, &text, 1000) == 0)
            Json::Reader().parse(text, v);
        return v;
    }
    // The daemon dropped the connection and the player's pid file is gone.
    bool Stopped()
    {
        Json::Value s = Status();
        return s.isObject() && s["fdMplayer"].asInt() == -1 && !h.Exists(TARN_MPLAYER_PID_FILE);
    }
    void StopAndWait()
    {
        ASSERT_EQ(0, h.Request(ACT_STOP, nullptr, nullptr, 3000));
        ASSERT_TRUE(WaitFor([&] { return Stopped(); }, 5000));
    }
    std::vector<localplay::Run> Runs(localplay::Wav *out = nullptr)
    {
        localplay::Wav wav;
        EXPECT_TRUE(localplay::LoadWav(wavPath, &wav)) << wavPath;
        if (out)
            *out = wav;
        return localplay::ToneRuns(wav, kTones);
    }
    double WavSeconds()
    {
        struct stat st;
        return stat(wavPath.c_str(), &st) == 0 && st.st_size >= 44
                   ? double(st.st_size - 44) / (44100.0 * 4) : 0.0;
    }
    int MplayerPid() { return atoi(h.ReadFile(TARN_MPLAYER_PID_FILE).c_str()); }

    tarntest::Harness h;
    std::string wavPath;
};

TEST_F(LocalPlaybackTest, QueuePlaysThroughAndEachSongFollows)
{
    Add("tone-440.mp3", "Demo Tone A440");
    Add("tone-660.flac", "Demo Tone E660");
    Add("tone-880.ogg", "Demo Tone A880");
    ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, "0"));
    ASSERT_TRUE(WaitFor([&] { return Status()["fdMplayer"].asInt() >= 0; }, 5000))
        << "mplayer-daemon did not connect";
    std::vector<std::string> titles;
    bool sawArtist = false, sawPosition = false, sawPlaying = false;
    ASSERT_TRUE(WaitFor(
        [&] {
            const PublishedStatusShm *pub = h.PublishedSegment();
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
    EXPECT_TRUE(sawArtist && sawPosition && sawPlaying);
    EXPECT_EQ(0, Status()["PlayerState"].asInt());

    std::vector<localplay::Run> runs = Runs();
    ASSERT_EQ(3u, runs.size()) << Describe(runs);
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(i, runs[i].tone) << Describe(runs);
        EXPECT_NEAR(2.0, runs[i].length, 0.15) << Describe(runs);
        double gap = i > 0 ? runs[i].start - (runs[i - 1].start + runs[i - 1].length) : 0;
        EXPECT_LT(gap, 0.5) << "each song follows without a noticeable pause";
    }
}

TEST_F(LocalPlaybackTest, RepeatOnePlaysTheSameSongAgain)
{
    Add("tone-440.mp3");
    Add("tone-660.flac");
    Add("tone-880.ogg");
    ASSERT_EQ(0, h.Request(ACT_SET_REPEAT_MODE, "2"));
    ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, "1"));
    ASSERT_TRUE(WaitFor([&] { return WavSeconds() >= 5.5; }, 15000));
    const PublishedStatusShm *pub = h.PublishedSegment();
    ASSERT_NE(nullptr, pub);
    EXPECT_EQ(1, pub->index);
    EXPECT_EQ(2, pub->repeatMode);
    StopAndWait();
    std::vector<localplay::Run> runs = Runs();
    double total = 0;
    for (const localplay::Run &r : runs) {
        EXPECT_EQ(1, r.tone) << Describe(runs);
        total += r.length;
    }
    EXPECT_GE(total, 4.5) << Describe(runs);
}

TEST_F(LocalPlaybackTest, RepeatAllWrapsToTheFirstSong)
{
    Add("tone-880.ogg");
    Add("tone-660.flac");
    ASSERT_EQ(0, h.Request(ACT_SET_REPEAT_MODE, "3"));
    ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, "0"));
    ASSERT_TRUE(WaitFor([&] { return WavSeconds() >= 8.8; }, 20000));
    StopAndWait();
    std::vector<localplay::Run> runs = Runs();
    ASSERT_GE(runs.size(), 5u) << Describe(runs);
    const int expect[] = {2, 1, 2, 1, 2};
    for (int i = 0; i < 5; ++i) {
        EXPECT_EQ(expect[i], runs[i].tone) << Describe(runs);
        EXPECT_NEAR(2.0, i < 4 ? runs[i].length : 2.0, 0.15) << Describe(runs);
    }
}

TEST_F(LocalPlaybackTest, PauseSeekVolumeMuteAndEqualizerReachThePlayer)
{
    Add("long-440.wav", "Long", 30.0f);
    ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, "0"));
    ASSERT_TRUE(WaitFor([&] { return Status()["Position"].asInt() >= 1; }, 10000));
    EXPECT_EQ(50, Status()["Volume"].asInt());

    // Pause: state 3 reported and published, the output stops growing.
    ASSERT_EQ(0, h.Request(ACT_PLAY_PAUSE));
    ASSERT_TRUE(WaitFor([&] { return Status()["PlayerState"].asInt() == 3; }, 3000));
    ASSERT_TRUE(WaitFor([&] { return h.PublishedSegment()->state == 3; }, 1000));
    double pausedAt = WavSeconds();
    SleepMs(1000);
    EXPECT_LT(WavSeconds() - pausedAt, 0.2);
    ASSERT_EQ(0, h.Request(ACT_PLAY_PAUSE));
    ASSERT_TRUE(WaitFor([&] { return Status()["PlayerState"].asInt() == 2; }, 3000));

    ASSERT_EQ(0, h.Request(ACT_SEEK, "15"));
    ASSERT_TRUE(WaitFor([&] { return Status()["Position"].asInt() >= 15; }, 3000));
    EXPECT_LT(Status()["Position"].asInt(), 19);

    // Output windows after each step: volume 50, volume 20, muted, unmuted,
    // equalizer -20 dB (heard about a second later, behind the player's buffer).
    struct Step { int action; const char *param; int settleMs; } steps[] = {
        {0, nullptr, 600}, {ACT_SET_VOLUME, "20", 500}, {ACT_MUTE, nullptr, 500},
        {ACT_MUTE, nullptr, 500},
        {ACT_SET_EQUALIZER, "-20.0 -20.0 -20.0 -20.0 -20.0 -20.0 -20.0 -20.0 -20.0 -20.0", 2000}};
    std::vector<std::pair<double, double>> windows;
    for (const Step &s : steps) {
        ASSERT_EQ(0, s.action ? h.Request(s.action, s.param) : 0);
        SleepMs(s.settleMs);
        double t0 = WavSeconds();
        SleepMs(600);
        windows.emplace_back(t0, WavSeconds());
    }
    EXPECT_EQ(20, Status()["Volume"].asInt());
    StopAndWait();

    localplay::Wav wav;
    Runs(&wav);
    double r[5];
    for (int i = 0; i < 5; ++i)
        r[i] = localplay::RmsBetween(wav, windows[i].first, windows[i].second);
    std::string figures = "rms vol50 " + std::to_string(r[0]) + " vol20 " + std::to_string(r[1]) +
                          " muted " + std::to_string(r[2]) + " unmuted " + std::to_string(r[3]) +
                          " eq " + std::to_string(r[4]);
    EXPECT_GT(r[0], 1000) << figures;
    EXPECT_LT(r[1], r[0] * 0.75) << figures;
    EXPECT_GT(r[1], r[0] * 0.05) << figures;
    EXPECT_LT(r[2], 50) << figures;
    EXPECT_NEAR(r[1], r[3], r[1] * 0.2) << figures;
    EXPECT_LT(r[4], r[3] * 0.3) << figures;
    EXPECT_LT(wav.Seconds(), 20.0);  // the seek skipped audio
}

// A stopped (SIGSTOP) or killed (SIGKILL) player never holds the daemon up.
TEST_F(LocalPlaybackTest, HungOrKilledPlayerDoesNotBlockTheDaemon)
{
    Add("long-440.wav", "Long", 30.0f);
    Add("tone-660.flac");
    ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, "0"));
    ASSERT_TRUE(WaitFor([&] { return Status()["Position"].asInt() >= 1; }, 10000));
    int pid = MplayerPid();
    ASSERT_GT(pid, 0);

    // Enough padded commands to fill the connection many times over.
    ASSERT_EQ(0, kill(pid, SIGSTOP));
    for (int i = 0; i < 300; ++i) {
        int action = (i % 3 == 0) ? ACT_SET_VOLUME : (i % 3 == 1) ? ACT_MUTE : ACT_SEEK;
        ASSERT_EQ(0, h.Request(action, "10", nullptr, 1000)) << "request " << i;
    }
    EXPECT_TRUE(h.WaitLog("MPlayer fd is not writable now", 2000));
    ASSERT_EQ(0, h.Request(ACT_NEXT, nullptr, nullptr, 1000));
    ASSERT_EQ(0, h.Request(ACT_PLAY_PAUSE, nullptr, nullptr, 1000));
    EXPECT_TRUE(Status().isObject());

    // Killed: the daemon goes on answering; play starts a new player.
    ASSERT_EQ(0, kill(pid, SIGKILL));
    kill(pid, SIGCONT);
    ASSERT_TRUE(WaitFor([&] { h.Reap(); return kill(pid, 0) != 0; }, 3000));
    for (int action : {ACT_SET_VOLUME, ACT_MUTE, ACT_SEEK, ACT_NEXT, ACT_PREVIOUS})
        ASSERT_EQ(0, h.Request(action, "30", nullptr, 1000)) << "action " << action;
    EXPECT_TRUE(Status().isObject());
    ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, "1", nullptr, 1000));
    ASSERT_TRUE(WaitFor([&] { return MplayerPid() > 0 && MplayerPid() != pid; }, 5000));
    ASSERT_TRUE(WaitFor(
        [&] {
            const PublishedStatusShm *pub = h.PublishedSegment();
            return pub && std::string(pub->currentUri) == Song("tone-660.flac") &&
                   pub->state == PLAYER_STATE_PLAYING && pub->index == 1;
        },
        5000));
    ASSERT_TRUE(WaitFor([&] { return Stopped(); }, 10000));
}

}  // namespace
