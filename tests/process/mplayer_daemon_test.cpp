// Local playback end to end: the real tarnaudiod starts the real
// mplayer-daemon, which plays generated tone songs into a WAV file. The WAV
// shows what was played and that commands took effect; the published segment
// and the status reply show what the daemon reports. Then mplayer-daemon
// alone against a test-side command socket and player status segment: every
// format, back to back.
#include <gtest/gtest.h>

#include <netinet/in.h>

#include <arpa/inet.h>

#include <json/json.h>
#include <poll.h>
#include <signal.h>
#include <sys/shm.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"
#include "tests/harness/harness.h"
#include "tests/process/localplay_wav.h"
#include "tools/mplayer-daemon/command_parser.h"

namespace {

using tarntest::MakeMediaInfo;
const std::vector<double> kTones = {440.0, 660.0, 880.0};

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
        s += std::to_string(int(kTones[r.tone])) + " Hz " + std::to_string(r.length) + " s; ";
    return s;
}

class LocalPlaybackTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
        std::string out, songs = h.Path("/songs");
        ASSERT_EQ(0, h.Run({"/bin/sh", tarntest::SourcePath("scripts/make-demo-songs.sh"), songs, "2"}, &out)) << out;
        ASSERT_EQ(0, h.Run({"/usr/bin/sox", "-q", "-n", "-r", "44100", "-c", "2", "-b", "16", songs + "/long-440.wav",
                            "synth", "30", "sine", "440", "gain", "-6"}, &out)) << out;
        wavPath = h.Root() + "/out.wav";
        setenv("TARN_AUDIO_OUT", ("wav:" + wavPath).c_str(), 1);
        ASSERT_EQ(0, h.Start()) << h.Error();
    }
    void TearDown() override
    {
        if (HasFailure())
            fprintf(stderr, "--- daemon log ---\n%s\n", h.Log().c_str());
    }

    std::string Song(const char *name) const { return h.Path("/songs/") + name; }
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

// "Repeat One" plays the second song again and again; "Repeat All" wraps
// to the first song after the last, each song played through.
TEST_F(LocalPlaybackTest, RepeatOneAndRepeatAll)
{
    Add("tone-880.ogg");
    Add("tone-660.flac");
    struct Case { const char *mode, *index; double seconds; std::string tones; } cases[] = {
        {"2", "1", 5.5, "1"}, {"3", "0", 8.8, "21212"}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.mode);
        ASSERT_EQ(0, h.Request(ACT_SET_REPEAT_MODE, c.mode));
        ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, c.index));
        ASSERT_TRUE(WaitFor([&] { return WavSeconds() >= c.seconds; }, 20000));
        const PublishedStatusShm *pub = h.PublishedSegment();
        ASSERT_NE(nullptr, pub);
        EXPECT_EQ(atoi(c.mode), pub->repeatMode);
        StopAndWait();
        localplay::Wav wav;
        std::vector<localplay::Run> runs = Runs(&wav);
        EXPECT_TRUE(wav.sizesFinal) << "the stopped player completes its WAV file";
        ASSERT_EQ(0, unlink(wavPath.c_str()));
        std::string tones;
        double total = 0;
        for (size_t i = 0; i < runs.size(); ++i) {
            tones += std::to_string(runs[i].tone);
            total += runs[i].length;
            bool whole = c.tones.size() > 1 && i + 1 < runs.size();  // songs played through
            EXPECT_NEAR(2.0, whole ? runs[i].length : 2.0, 0.15) << Describe(runs);
        }
        EXPECT_EQ(0u, tones.find(c.tones)) << Describe(runs);
        EXPECT_EQ(std::string::npos, tones.find_first_not_of(c.tones)) << Describe(runs);
        EXPECT_GE(total, c.seconds - 1.0) << Describe(runs);
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
    std::string figures = "rms at volume 50, 20, muted, unmuted, -20 dB:";
    for (double v : r)
        figures += " " + std::to_string(int(v));
    EXPECT_GT(r[0], 1000) << figures;
    EXPECT_LT(r[1], r[0] * 0.75) << figures;
    EXPECT_GT(r[1], r[0] * 0.05) << figures;
    EXPECT_LT(r[2], 50) << figures;
    EXPECT_NEAR(r[1], r[3], r[1] * 0.2) << figures;
    EXPECT_LT(r[4], r[3] * 0.3) << figures;
    EXPECT_LT(wav.Seconds(), 20.0);  // the seek skipped audio
}

// A player process that is slow to come up (a first start builds
// GStreamer's registry) is not started twice nor killed half-way by a second
// play request: the song asked for meanwhile is loaded once it connects.
TEST_F(LocalPlaybackTest, PlayWhileThePlayerStartsGoesToThatPlayer)
{
    Add("long-440.wav", "Long", 30.0f);
    Add("tone-660.flac");
    const std::string bin = h.Path(TARN_MPLAYER_BIN), starts = h.Path("/starts.log");
    ASSERT_EQ(0, rename(bin.c_str(), (bin + ".real").c_str()));
    ASSERT_EQ(0, h.WriteFile(TARN_MPLAYER_BIN, "#!/bin/sh\necho start >> '" + starts + "'\nsleep 1\nexec '" +
                                                   bin + ".real' \"$@\"\n"));
    ASSERT_EQ(0, chmod(bin.c_str(), 0755));

    ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, "0"));
    usleep(200 * 1000);
    ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, "1"));
    const PublishedStatusShm *pub = h.PublishedSegment();
    ASSERT_TRUE(WaitFor([&] { return pub && std::string(pub->currentUri) == Song("tone-660.flac") &&
                                     Status()["Position"].asInt() >= 1; }, 10000))
        << Status().toStyledString();
    Json::Value s = Status();
    EXPECT_EQ(PLAYER_STATE_PLAYING, s["PlayerState"].asInt());
    EXPECT_EQ("", s["last_error"].asString());
    EXPECT_EQ(0, s["error_count"].asInt());
    EXPECT_EQ("start\n", h.ReadFile("/starts.log")) << "one player process";
    StopAndWait();
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
    // The daemon sees its player gone: stopped, with the reason kept for
    // status, never "playing" with a frozen position.
    ASSERT_TRUE(WaitFor([&] { return Status()["PlayerState"].asInt() == PLAYER_STATE_STOPPED; }, 2000));
    EXPECT_EQ("the player program ended unexpectedly", Status()["last_error"].asString());
    EXPECT_TRUE(WaitFor([&] { return h.PublishedSegment()->state == PLAYER_STATE_STOPPED; }, 1000));
    for (int action : {ACT_SET_VOLUME, ACT_MUTE, ACT_SEEK, ACT_NEXT, ACT_PREVIOUS})
        ASSERT_EQ(0, h.Request(action, "30", nullptr, 1000)) << "action " << action;
    EXPECT_TRUE(Status().isObject());
    ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, "1", nullptr, 1000));
    ASSERT_TRUE(WaitFor([&] { return MplayerPid() > 0 && MplayerPid() != pid; }, 5000));
    const PublishedStatusShm *pub = h.PublishedSegment();
    ASSERT_TRUE(WaitFor([&] { return pub && std::string(pub->currentUri) == Song("tone-660.flac") &&
                                     pub->state == PLAYER_STATE_PLAYING && pub->index == 1; }, 5000));
    ASSERT_TRUE(WaitFor([&] { return Stopped(); }, 10000));
}

// A sine tone file: mp3 through lame, m4a through GStreamer, others through sox.
bool MakeTone(const std::string &path, int freq, int seconds, int rate = 44100, int channels = 2)
{
    std::string q = "'" + path + "'", ext = path.substr(path.rfind('.') + 1), f = std::to_string(freq);
    std::string sox = "sox -n -r " + std::to_string(rate) + " -c " + std::to_string(channels) + " -b 16 " +
                      (ext == "mp3" ? "-t wav -" : q) + " synth " + std::to_string(seconds) + " sine " + f +
                      " vol 0.5" + (ext == "mp3" ? " | lame --quiet -b 128 -t - " + q : "");
    std::string gst = "gst-launch-1.0 -q audiotestsrc num-buffers=" + std::to_string(seconds * rate / 1024) +
                      " samplesperbuffer=1024 freq=" + f + " volume=0.5 ! audio/x-raw,rate=" +
                      std::to_string(rate) + " ! audioconvert ! avenc_aac ! mp4mux ! filesink location=" + q;
    return system(((ext == "m4a" ? gst : sox) + " >/dev/null 2>&1").c_str()) == 0;
}

std::string Load(const std::string &uri) { return "loadfile \"" + MplayerEscapeUri(uri) + "\""; }
std::string Text(const volatile char *p, size_t n)
{
    const char *c = const_cast<const char *>(p);
    return std::string(c, strnlen(c, n));
}

// A radio station on loopback: the demo mp3 looped at about 128 kbit/s,
// an ICY name, and a metadata block every 8000 bytes whose stream title
// changes after 5 s.
struct IcyStation {
    int listenFd = -1;
    std::atomic<bool> stop{false};
    std::thread thread;
    std::string Start(const std::string &mp3)
    {
        listenFd = socket(AF_INET, SOCK_STREAM, 0);
        sockaddr_in a{};
        a.sin_family = AF_INET;
        a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t len = sizeof(a);
        if (bind(listenFd, (sockaddr *)&a, len) != 0 || listen(listenFd, 4) != 0 ||
            getsockname(listenFd, (sockaddr *)&a, &len) != 0)
            return "";
        thread = std::thread([this, mp3] {
            for (int fd; !stop && (fd = accept(listenFd, nullptr, nullptr)) >= 0; close(fd)) {
                char req[4096];
                if (read(fd, req, sizeof(req)) <= 0)
                    continue;
                std::string out = "HTTP/1.0 200 OK\r\nContent-Type: audio/mpeg\r\nicy-name: Tarn Test Radio\r\n"
                                  "icy-metaint: 8000\r\n\r\n";
                auto t0 = std::chrono::steady_clock::now();
                for (size_t sent = 0, pos = 0; !stop; sent += 8000) {
                    for (size_t block = 0; block < 8000;) {
                        size_t n = std::min(8000 - block, mp3.size() - pos);
                        out.append(mp3, pos, n);
                        block += n;
                        pos = (pos + n) % mp3.size();
                    }
                    double secs = std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count();
                    std::string m = std::string("StreamTitle='") + (secs < 5 ? "First Song" : "Second Song") + "';";
                    m.resize((m.size() + 15) / 16 * 16, '\0');
                    out += char(m.size() / 16) + m;
                    if (send(fd, out.data(), out.size(), MSG_NOSIGNAL) < 0)
                        break;
                    out.clear();
                    if (sent > 32000)
                        SleepMs(500);  // 8000 bytes a half second after a short burst
                }
            }
        });
        return "http://127.0.0.1:" + std::to_string(ntohs(a.sin_port)) + "/stream";
    }
    ~IcyStation()
    {
        stop = true;
        shutdown(listenFd, SHUT_RDWR);
        close(listenFd);
        if (thread.joinable())
            thread.join();
    }
};

// A radio stream: the published title is the stream title, the artist the
// station name, and both follow the stream.
TEST_F(LocalPlaybackTest, RadioStreamPublishesStationAndChangingTitle)
{
    IcyStation station;
    std::string url = station.Start(h.ReadFile("/songs/tone-440.mp3"));
    ASSERT_FALSE(url.empty());
    ASSERT_EQ(0, h.QueueAdd(MakeMediaInfo(url, "Queue Entry", "Queue Artist", 0)));
    ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, "0"));
    auto published = [&](const char *title) {
        const PublishedStatusShm *pub = h.PublishedSegment();
        return pub && std::string(pub->title) == title && std::string(pub->artist) == "Tarn Test Radio";
    };
    EXPECT_TRUE(WaitFor([&] { return published("First Song"); }, 10000)) << h.PublishedSegment()->title;
    EXPECT_TRUE(WaitFor([&] { return published("Second Song"); }, 15000)) << h.PublishedSegment()->title;
    EXPECT_EQ(PLAYER_STATE_PLAYING, h.PublishedSegment()->state);
    StopAndWait();
}

class MplayerDaemonTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
        shmId_ = shmget(TarnShmKeyPlayer(), sizeof(PlayerStatusShm), IPC_CREAT | 0666);
        ASSERT_GE(shmId_, 0) << strerror(errno);
        void *p = shmat(shmId_, nullptr, 0);
        ASSERT_NE(p, (void *)-1);
        memset(p, 0, sizeof(PlayerStatusShm));
        seg_ = static_cast<volatile PlayerStatusShm *>(p);
        wav_ = h_.Path("/out.wav");
        setenv("TARN_AUDIO_OUT", ("wav:" + wav_).c_str(), 1);
        ASSERT_EQ(0, h_.Run({"/bin/mkdir", "-p", h_.Path("/media")}));
        listen_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un addr = {};
        addr.sun_family = AF_UNIX;
        snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", h_.Path(TARN_MPLAYER_SOCKET).c_str());
        ASSERT_EQ(0, bind(listen_, (sockaddr *)&addr, sizeof(addr)));
        ASSERT_EQ(0, listen(listen_, 1));
    }
    void TearDown() override
    {
        for (int fd : {conn_, listen_})
            if (fd >= 0)
                close(fd);
        shmdt(const_cast<PlayerStatusShm *>(seg_));
    }
    std::string Media(const std::string &name) { return h_.Path("/media/") + name; }

    // Starts the player the way the daemon does and takes its connection.
    void StartConnected(const std::string &uri, int volume = 100)
    {
        pid_ = h_.Spawn({tarntest::BinPath("mplayer-daemon"), uri, "-loop", "0", "-daemon", "-volume",
                         std::to_string(volume), "-af", "equalizer=0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0"});
        ASSERT_GT(pid_, 0) << h_.Error();
        pollfd p = {listen_, POLLIN, 0};
        ASSERT_EQ(1, poll(&p, 1, 10000)) << "mplayer-daemon did not connect";
        conn_ = accept4(listen_, nullptr, nullptr, SOCK_CLOEXEC);
        ASSERT_GE(conn_, 0);
    }
    bool Send(const std::string &b) { return write(conn_, b.data(), b.size()) == ssize_t(b.size()); }
    std::string Uri() { return Text(seg_->currentUri, sizeof(seg_->currentUri)); }
    void ExpectPlaying(const std::string &uri, int duration)
    {
        EXPECT_TRUE(WaitFor([&] { return seg_->state == PLAYER_STATE_PLAYING && Uri() == uri; }, 5000))
            << "state " << seg_->state << " uri [" << Uri() << "]";
        EXPECT_TRUE(WaitFor([&] { return seg_->duration == duration; }, 5000)) << uri;
    }
    // Waits for the end of the song and answers like the daemon (2 back).
    void ExpectEndAndAck(int timeoutMs)
    {
        ASSERT_TRUE(WaitFor([&] { return seg_->state == PLAYER_STATE_ENDED; }, timeoutMs))
            << "state " << seg_->state << " position " << seg_->position;
        seg_->state = PLAYER_STATE_PLAYING;
    }
    // Exit status 0, and the pid file removed.
    void ExpectCleanExit()
    {
        EXPECT_EQ(0, h_.WaitExit(pid_, 8000));
        EXPECT_FALSE(h_.Exists(TARN_MPLAYER_PID_FILE)) << "pid file left behind";
    }

    tarntest::Harness h_;
    int shmId_ = -1, listen_ = -1, conn_ = -1;
    pid_t pid_ = -1;
    volatile PlayerStatusShm *seg_ = nullptr;
    std::string wav_;
};

TEST_F(MplayerDaemonTest, PlaysEveryFormatBackToBackIntoOneWav)
{
    struct Song { std::string file, uri; int freq, seconds, rate, channels; } songs[] = {
        {Media("tone a.mp3"), "", 440, 3, 44100, 2},
        {Media("tone\\b.flac"), "", 660, 2, 48000, 1},
        {Media("tone \"c\".ogg"), "", 880, 2, 22050, 2},
        {Media("tone-d.m4a"), "", 550, 2, 44100, 2},
    };
    for (Song &s : songs) {
        s.uri = (s.file.find(".m4a") != std::string::npos ? "file://" : "") + s.file;
        ASSERT_TRUE(MakeTone(s.file, s.freq, s.seconds, s.rate, s.channels)) << s.file;
    }
    StartConnected(songs[0].uri);
    EXPECT_EQ(std::to_string(pid_) + "\n", h_.ReadFile(TARN_MPLAYER_PID_FILE));
    for (size_t i = 0; i < 4; ++i) {
        ASSERT_TRUE(i == 0 || Send(Load(songs[i].uri)));
        ExpectPlaying(songs[i].uri, songs[i].seconds);
        EXPECT_TRUE(i > 0 || (WaitFor([&] { return seg_->position >= 1; }, 3000) &&
                              WaitFor([&] { return seg_->position >= 2; }, 3000)))
            << "the position moves with the playing time";
        ExpectEndAndAck(songs[i].seconds * 1000 + 5000);
        EXPECT_EQ(songs[i].seconds, seg_->position);
    }
    EXPECT_EQ(-1, h_.WaitExit(pid_, 300));  // after the last song it waits for a loadfile
    ASSERT_TRUE(Send("quit"));
    ExpectCleanExit();

    localplay::Wav w;
    ASSERT_TRUE(localplay::LoadWav(wav_, &w));
    EXPECT_TRUE(w.sizesFinal);
    EXPECT_EQ(44100, w.rate);
    EXPECT_EQ(2, w.channels);
    EXPECT_NEAR(9.0, w.Seconds(), 0.3);
    std::vector<localplay::Run> runs = localplay::ToneRuns(w, {440, 660, 880, 550});
    ASSERT_EQ(4u, runs.size());
    for (int i = 0; i < 4; ++i) {
        EXPECT_EQ(i, runs[i].tone);
        EXPECT_NEAR(songs[i].seconds, runs[i].length, 0.2) << songs[i].file;
        EXPECT_GT(runs[i].rms, 0.2 * 32768) << songs[i].file;
    }
}

}  // namespace
