// mplayer-daemon playing an internet radio stream: a small ICY server on
// 127.0.0.1 run by the test sends an mp3 stream with in-band metadata whose
// stream title changes; the station name and the titles must show up in the
// player status segment.
#include "tests/process/mplayer_process_util.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <atomic>
#include <mutex>
#include <netinet/in.h>
#include <string>
#include <thread>

using namespace mptest;

namespace {

// One listener, one client at a time. The mp3 data is sent in a loop at its
// bit rate (after a short burst that fills the player's buffer), with a
// metadata block after every kMetaInt bytes when the client asks for it.
class IcyServer {
public:
    static const int kMetaInt = 8000;

    ~IcyServer() { Stop(); }

    bool Start(const std::string &mp3, const std::string &station,
               const std::vector<std::string> &titles, double secondsPerTitle,
               double streamSeconds)
    {
        mp3_ = mp3;
        station_ = station;
        titles_ = titles;
        secondsPerTitle_ = secondsPerTitle;
        streamSeconds_ = streamSeconds;
        fd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        struct sockaddr_in a;
        memset(&a, 0, sizeof(a));
        a.sin_family = AF_INET;
        a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t len = sizeof(a);
        if (fd_ < 0 || bind(fd_, reinterpret_cast<struct sockaddr *>(&a), sizeof(a)) != 0 ||
            listen(fd_, 4) != 0 ||
            getsockname(fd_, reinterpret_cast<struct sockaddr *>(&a), &len) != 0)
            return false;
        port_ = ntohs(a.sin_port);
        thread_ = std::thread([this] { Serve(); });
        return true;
    }
    void Stop()
    {
        stop_ = true;
        if (thread_.joinable())
            thread_.join();
        if (fd_ >= 0)
            close(fd_);
        fd_ = -1;
    }
    std::string Url() const { return "http://127.0.0.1:" + std::to_string(port_) + "/stream"; }
    std::string Request()
    {
        std::lock_guard<std::mutex> l(mutex_);
        return request_;
    }
    int Clients() const { return clients_; }

private:
    void Serve()
    {
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(120);
        while (!stop_ && std::chrono::steady_clock::now() < deadline) {
            struct pollfd p = {fd_, POLLIN, 0};
            if (poll(&p, 1, 100) != 1)
                continue;
            int c = accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
            if (c < 0)
                continue;
            ++clients_;
            ServeClient(c, deadline);
            close(c);
        }
    }

    bool SendAll(int c, const std::string &s)
    {
        size_t off = 0;
        while (off < s.size() && !stop_) {
            ssize_t n = send(c, s.data() + off, s.size() - off, MSG_NOSIGNAL);
            if (n <= 0)
                return false;
            off += static_cast<size_t>(n);
        }
        return off == s.size();
    }

    void ServeClient(int c, std::chrono::steady_clock::time_point deadline)
    {
        std::string req;
        char buf[1024];
        while (req.find("\r\n\r\n") == std::string::npos && req.size() < 8192 && !stop_) {
            struct pollfd p = {c, POLLIN, 0};
            if (poll(&p, 1, 100) != 1)
                continue;
            ssize_t n = recv(c, buf, sizeof(buf), 0);
            if (n <= 0)
                return;
            req.append(buf, static_cast<size_t>(n));
        }
        {
            std::lock_guard<std::mutex> l(mutex_);
            request_ = req;
        }
        std::string lower = req;
        for (char &ch : lower)
            ch = static_cast<char>(tolower(static_cast<unsigned char>(ch)));
        bool meta = lower.find("icy-metadata: 1") != std::string::npos;
        std::string head = "HTTP/1.0 200 OK\r\nContent-Type: audio/mpeg\r\nicy-name: " + station_ +
                           "\r\nicy-genre: Test\r\nicy-br: 128\r\n";
        if (meta)
            head += "icy-metaint: " + std::to_string(kMetaInt) + "\r\n";
        head += "\r\n";
        if (!SendAll(c, head))
            return;

        const double bytesPerSecond = 16000.0;  // 128 kbit/s
        const size_t burst = 32000;             // 2 s
        const size_t total = static_cast<size_t>(streamSeconds_ * bytesPerSecond);
        auto start = std::chrono::steady_clock::now();
        size_t sent = 0;
        size_t at = 0;
        while (!stop_ && sent < total && std::chrono::steady_clock::now() < deadline) {
            std::string block;
            size_t want = std::min(static_cast<size_t>(kMetaInt), total - sent);
            while (block.size() < want) {
                size_t n = std::min(want - block.size(), mp3_.size() - at);
                block.append(mp3_, at, n);
                at = (at + n) % mp3_.size();
            }
            if (block.size() == static_cast<size_t>(kMetaInt) && meta) {
                size_t idx = static_cast<size_t>(sent / bytesPerSecond / secondsPerTitle_);
                if (idx >= titles_.size())
                    idx = titles_.size() - 1;
                // Sent with every block, changed or not, as many servers do.
                std::string m = "StreamTitle='" + titles_[idx] + "';";
                size_t padded = (m.size() + 15) / 16 * 16;
                m.resize(padded, '\0');
                block += static_cast<char>(padded / 16);
                block += m;
            }
            if (!SendAll(c, block))
                return;
            sent += want;
            if (sent > burst) {
                auto due = start + std::chrono::milliseconds(
                                       static_cast<long>((sent - burst) / bytesPerSecond * 1000));
                while (!stop_ && std::chrono::steady_clock::now() < due)
                    SleepMs(10);
            }
        }
    }

    std::string mp3_, station_;
    std::vector<std::string> titles_;
    double secondsPerTitle_ = 4;
    double streamSeconds_ = 60;
    int fd_ = -1;
    int port_ = 0;
    std::thread thread_;
    std::atomic<bool> stop_{false};
    std::atomic<int> clients_{0};
    std::mutex mutex_;
    std::string request_;
};

class MplayerRadioTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        static int salt = 0;
        key_ = UniqueShmKey(8 + ++salt);
        ASSERT_TRUE(seg_.Create(key_));
        std::string file = root_.Path("/media/tone.mp3");
        ASSERT_TRUE(MakeTone(file, 440, 3));
        mp3_ = ReadFile(file);
        ASSERT_GT(mp3_.size(), 10000u);
        wav_ = root_.Path("/out.wav");
        ASSERT_TRUE(sock_.Listen(root_.Path("/tmp/mplayer.sock")));
    }

    TempRoot root_;
    int key_ = 0;
    std::string mp3_;
    std::string wav_;
    PlayerSegment seg_;
    CommandSocket sock_;
    PlayerProcess player_;
};

TEST_F(MplayerRadioTest, StationNameAndChangingStreamTitle)
{
    IcyServer server;
    ASSERT_TRUE(server.Start(mp3_, "Tarn Test Radio", {"First Song", "Second Song - Artist \xc3\xa9"},
                             5.0, 60.0));
    ASSERT_TRUE(player_.Start(root_, key_, "wav:" + wav_, server.Url(), 80));
    ASSERT_TRUE(sock_.Accept(10000));

    EXPECT_TRUE(WaitFor([&] { return seg_.Uri() == server.Url(); }, 2000)) << seg_.Uri();
    EXPECT_TRUE(WaitFor([&] { return seg_.Station() == "Tarn Test Radio"; }, 10000))
        << "station [" << seg_.Station() << "]";
    EXPECT_TRUE(WaitFor([&] { return seg_.Title() == "First Song"; }, 10000))
        << "title [" << seg_.Title() << "]";
    EXPECT_TRUE(WaitFor([&] { return seg_.Position() >= 1; }, 5000));
    EXPECT_EQ(seg_.State(), PLAYER_STATE_PLAYING);
    EXPECT_EQ(seg_.Duration(), -1);
    EXPECT_TRUE(WaitFor([&] { return seg_.Title() == "Second Song - Artist \xc3\xa9"; }, 15000))
        << "title [" << seg_.Title() << "]";
    EXPECT_EQ(seg_.Station(), "Tarn Test Radio");
    EXPECT_EQ(seg_.State(), PLAYER_STATE_PLAYING);
    // The player asked for the in-band metadata.
    std::string req = server.Request();
    for (char &c : req)
        c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
    EXPECT_NE(req.find("icy-metadata: 1"), std::string::npos) << req;

    // A seek on a live stream is refused without harm.
    ASSERT_TRUE(sock_.Padded("seek 30"));
    SleepMs(500);
    EXPECT_EQ(seg_.State(), PLAYER_STATE_PLAYING);

    ASSERT_TRUE(sock_.Raw("quit"));
    EXPECT_EQ(player_.WaitExit(8000), 0);
    server.Stop();
    Wav w = ReadWav(wav_);
    ASSERT_TRUE(w.ok) << w.why;
    EXPECT_GT(w.Seconds(), 5.0);
    EXPECT_NEAR(w.Frequency(0.5, 2.5), 440, 5);  // inside the first pass of the looped file
}

// A stream that the server ends counts as an ended song, and a local song
// after the radio clears the station and title.
TEST_F(MplayerRadioTest, StreamEndIsSongEndAndLocalSongClearsStation)
{
    // A title longer than its field (264 bytes) in two-byte characters: cut
    // at a character boundary.
    std::string e = "\xc3\xa9";
    std::string longTitle;
    for (int i = 0; i < 150; ++i)
        longTitle += e;
    std::string cut;
    for (int i = 0; i < 131; ++i)
        cut += e;
    IcyServer server;
    ASSERT_TRUE(server.Start(mp3_, "Short Radio", {longTitle}, 100.0, 4.0));
    ASSERT_TRUE(player_.Start(root_, key_, "wav:" + wav_, server.Url()));
    ASSERT_TRUE(sock_.Accept(10000));
    EXPECT_TRUE(WaitFor([&] { return seg_.Station() == "Short Radio"; }, 10000));
    EXPECT_TRUE(WaitFor([&] { return seg_.Title() == cut; }, 10000))
        << seg_.Title().size() << " bytes: [" << seg_.Title() << "]";
    ASSERT_TRUE(WaitFor([&] { return seg_.State() == PLAYER_STATE_ENDED; }, 20000))
        << "state " << seg_.State();
    seg_.SetState(PLAYER_STATE_PLAYING);

    std::string local = root_.Path("/media/local.ogg");
    ASSERT_TRUE(MakeTone(local, 660, 2));
    ASSERT_TRUE(sock_.Load(local));
    EXPECT_TRUE(WaitFor([&] { return seg_.Uri() == local && seg_.Duration() == 2; }, 5000));
    EXPECT_EQ(seg_.Station(), "");
    EXPECT_EQ(seg_.Title(), "");
    ASSERT_TRUE(WaitFor([&] { return seg_.State() == PLAYER_STATE_ENDED; }, 8000));
    ASSERT_TRUE(sock_.Raw("quit"));
    EXPECT_EQ(player_.WaitExit(8000), 0);
}

}  // namespace
