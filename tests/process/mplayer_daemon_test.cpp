// The real mplayer-daemon against a test-side command socket and player
// status segment: songs of several formats played into one WAV file, garbage
// on the command stream, the ways the process ends, and an internet radio
// stream from a small ICY server on 127.0.0.1 with changing stream titles.
#include <gtest/gtest.h>

#include <poll.h>
#include <signal.h>
#include <sys/shm.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include <httplib.h>

#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"
#include "tests/harness/harness.h"
#include "tests/process/localplay_wav.h"
#include "tools/mplayer-daemon/command_parser.h"

namespace {

bool WaitFor(const std::function<bool()> &cond, int timeoutMs)
{
    auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    for (;;) {
        if (cond())
            return true;
        if (std::chrono::steady_clock::now() >= end)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
}
void SleepMs(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }

// A sine tone file; the format follows the extension (mp3 through lame, m4a
// through GStreamer, the rest through sox).
bool MakeTone(const std::string &path, int freq, int seconds, int rate = 44100, int channels = 2)
{
    std::string q = "'" + path + "'", ext = path.substr(path.rfind('.') + 1);
    std::string sox = "sox -n -r " + std::to_string(rate) + " -c " + std::to_string(channels) +
                      " -b 16 %s synth " + std::to_string(seconds) + " sine " +
                      std::to_string(freq) + " vol 0.5";
    std::string cmd;
    if (ext == "mp3")
        cmd = "sox -n -r 44100 -c 2 -b 16 -t wav - synth " + std::to_string(seconds) + " sine " +
              std::to_string(freq) + " vol 0.5 | lame --quiet -b 128 -t - " + q;
    else if (ext == "m4a")
        cmd = "gst-launch-1.0 -q audiotestsrc num-buffers=" + std::to_string(seconds * rate / 1024) +
              " samplesperbuffer=1024 freq=" + std::to_string(freq) + " volume=0.5 ! audio/x-raw,rate=" +
              std::to_string(rate) + " ! audioconvert ! avenc_aac ! mp4mux ! filesink location=" + q;
    else
        cmd = sox.replace(sox.find("%s"), 2, q);
    return system((cmd + " >/dev/null 2>&1").c_str()) == 0;
}

std::string Padded(const std::string &text)
{
    std::string b(2048, '\0');
    return b.replace(0, text.size(), text);
}
std::string Load(const std::string &uri) { return "loadfile \"" + MplayerEscapeUri(uri) + "\""; }
std::string Text(const volatile char *p, size_t n)
{
    std::string s;
    for (size_t i = 0; i < n && p[i]; ++i)
        s += p[i];
    return s;
}

// An ICY stream on loopback: an mp3 looped at 128 kbit/s (after a 2 s
// burst), with a metadata block after every kMetaInt bytes when asked for,
// its stream title changing after 5 s.
class IcyServer {
public:
    static const int kMetaInt = 8000;
    ~IcyServer() { Stop(); }
    bool Start(const std::string &mp3, const std::vector<std::string> &titles)
    {
        server_.Get("/stream", [this, mp3, titles](const httplib::Request &req, httplib::Response &res) {
            bool meta = req.get_header_value("Icy-MetaData") == "1";
            askedForMeta_ = askedForMeta_ || meta;
            res.set_header("icy-name", "Tarn Test Radio");
            if (meta)
                res.set_header("icy-metaint", std::to_string(kMetaInt));
            auto start = std::chrono::steady_clock::now();
            res.set_chunked_content_provider(
                "audio/mpeg", [=, sent = size_t(0), pos = size_t(0)](size_t, httplib::DataSink &sink) mutable {
                    std::string block;
                    while (block.size() < size_t(kMetaInt)) {
                        size_t n = std::min(kMetaInt - block.size(), mp3.size() - pos);
                        block.append(mp3, pos, n);
                        pos = (pos + n) % mp3.size();
                    }
                    if (meta) {  // sent with every block, changed or not, as many servers do
                        size_t idx = std::min(titles.size() - 1, size_t(sent / 16000.0 / 5.0));
                        std::string m = "StreamTitle='" + titles[idx] + "';";
                        m.resize((m.size() + 15) / 16 * 16, '\0');
                        block += char(m.size() / 16) + m;
                    }
                    sent += kMetaInt;
                    auto due = start + std::chrono::milliseconds(long((double(sent) - 32000) / 16.0));
                    while (!stop_ && std::chrono::steady_clock::now() < due)
                        SleepMs(10);
                    return !stop_ && sink.write(block.data(), block.size());
                });
        });
        int port = server_.bind_to_any_port("127.0.0.1");
        url_ = "http://127.0.0.1:" + std::to_string(port) + "/stream";
        thread_ = std::thread([this] { server_.listen_after_bind(); });
        return port > 0;
    }
    void Stop()
    {
        stop_ = true;
        server_.stop();
        if (thread_.joinable())
            thread_.join();
    }
    std::string Url() const { return url_; }
    bool AskedForMeta() const { return askedForMeta_; }

private:
    httplib::Server server_;
    std::string url_;
    std::thread thread_;
    std::atomic<bool> stop_{false}, askedForMeta_{false};
};

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
        for (const char *proxy : {"http_proxy", "HTTP_PROXY", "all_proxy", "ALL_PROXY"})
            unsetenv(proxy);  // nothing between the player and the loopback server
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
    bool Send(const std::string &bytes)
    {
        return write(conn_, bytes.data(), bytes.size()) == ssize_t(bytes.size());
    }
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

TEST_F(MplayerDaemonTest, GarbageOnTheCommandStreamIsSkipped)
{
    std::string song = Media("long.ogg");
    ASSERT_TRUE(MakeTone(song, 440, 8));
    StartConnected(song);
    ExpectPlaying(song, 8);
    ASSERT_TRUE(Send(std::string("\x01\x02junk 99 \xff\xfe", 13) + Padded("setvol 30") +
                     "more junk!" + "pause"));
    EXPECT_TRUE(WaitFor([&] { return seg_->state == PLAYER_STATE_PAUSED && seg_->value4104 == 30; }, 2000))
        << "state " << seg_->state << " volume " << seg_->value4104;
    ASSERT_TRUE(Send("quit"));
    ExpectCleanExit();
    EXPECT_NE(std::string::npos, h_.Log().find("not a command")) << h_.Log();
}

// SIGTERM and a closed connection both end the player cleanly, with a WAV
// file whose sizes are final.
TEST_F(MplayerDaemonTest, SigtermOrClosedConnectionCompletesTheWavFile)
{
    std::string song = Media("s.mp3");
    ASSERT_TRUE(MakeTone(song, 440, 10));
    for (bool bySignal : {true, false}) {
        SCOPED_TRACE(bySignal ? "SIGTERM" : "closed connection");
        memset(const_cast<PlayerStatusShm *>(seg_), 0, sizeof(PlayerStatusShm));
        StartConnected(song);
        ASSERT_TRUE(WaitFor([&] { return seg_->position >= 1; }, 5000));
        SleepMs(500);
        if (bySignal)
            kill(pid_, SIGTERM);
        close(conn_);
        conn_ = -1;
        ExpectCleanExit();
        localplay::Wav w;
        ASSERT_TRUE(localplay::LoadWav(wav_, &w));
        EXPECT_TRUE(w.sizesFinal);
        EXPECT_GT(w.Seconds(), 1.2);
        EXPECT_LT(w.Seconds(), 4.0);
        std::vector<localplay::Run> runs = localplay::ToneRuns(w, {440});
        ASSERT_EQ(1u, runs.size());
    }
}

TEST_F(MplayerDaemonTest, UnplayableSongIsReportedAsEnded)
{
    std::string bad = Media("bad.mp3"), good = Media("good.flac");
    std::string noise(20000, '\0');
    for (int i = 0; i < 20000; ++i)
        noise[i] = char((i * 7919) & 0xff);
    ASSERT_EQ(0, h_.WriteFile("/media/bad.mp3", noise));
    ASSERT_TRUE(MakeTone(good, 440, 2));
    StartConnected(bad);
    ExpectEndAndAck(8000);
    EXPECT_EQ(bad, Uri());
    for (std::string uri : {Media("missing.mp3"), std::string("http://127.0.0.1:1/station")}) {
        ASSERT_TRUE(Send(Load(uri)));
        ExpectEndAndAck(8000);
    }
    ASSERT_TRUE(Send(Load(good)));
    ExpectPlaying(good, 2);
    ExpectEndAndAck(8000);
    ASSERT_TRUE(Send("quit"));
    ExpectCleanExit();
    std::string log = h_.Log();
    EXPECT_NE(std::string::npos, log.find("Failed to play [" + bad + "]")) << log;
    EXPECT_NE(std::string::npos, log.find("missing.mp3")) << log;
    EXPECT_NE(std::string::npos, log.find("127.0.0.1:1/station")) << log;
}

TEST_F(MplayerDaemonTest, RadioStationNameAndChangingStreamTitle)
{
    std::string file = Media("tone.mp3");
    ASSERT_TRUE(MakeTone(file, 440, 3));
    IcyServer server;
    const std::string second = "Second Song - Artist \xc3\xa9";
    ASSERT_TRUE(server.Start(h_.ReadFile("/media/tone.mp3"), {"First Song", second}));
    StartConnected(server.Url(), 80);
    auto station = [&] { return Text(seg_->radioStation, sizeof(seg_->radioStation)); };
    auto title = [&] { return Text(seg_->streamTitle, sizeof(seg_->streamTitle)); };
    EXPECT_TRUE(WaitFor([&] { return Uri() == server.Url(); }, 2000)) << Uri();
    EXPECT_TRUE(WaitFor([&] { return station() == "Tarn Test Radio"; }, 10000)) << station();
    EXPECT_TRUE(WaitFor([&] { return title() == "First Song"; }, 10000)) << title();
    EXPECT_TRUE(WaitFor([&] { return seg_->position >= 1; }, 5000));
    EXPECT_EQ(PLAYER_STATE_PLAYING, seg_->state);
    EXPECT_EQ(-1, seg_->duration);
    EXPECT_TRUE(WaitFor([&] { return title() == second; }, 15000)) << title();
    EXPECT_EQ("Tarn Test Radio", station());
    EXPECT_TRUE(server.AskedForMeta());

    // A seek on a live stream is refused without harm.
    ASSERT_TRUE(Send(Padded("seek 30")));
    SleepMs(500);
    EXPECT_EQ(PLAYER_STATE_PLAYING, seg_->state);
    ASSERT_TRUE(Send("quit"));
    ExpectCleanExit();
    server.Stop();
    localplay::Wav w;
    ASSERT_TRUE(localplay::LoadWav(wav_, &w));
    EXPECT_GT(w.Seconds(), 5.0);
    std::vector<localplay::Run> runs = localplay::ToneRuns(w, {440});
    ASSERT_FALSE(runs.empty());
    EXPECT_GT(runs[0].length, 2.0);
}

}  // namespace
