// Radio directory updaters against a directory served on 127.0.0.1 by the
// test itself: good answers, garbage, errors, oversized and slow answers.
#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <atomic>
#include <chrono>
#include <ctime>
#include <mutex>
#include <netinet/in.h>
#include <string>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>
#include <utime.h>
#include <vector>

#include <httplib.h>
#include <json/json.h>

#include "daemon/tarn_types.h"
#include "platform/radio_fetch.h"
#include "source/radiolist.h"
#include "tests/harness/harness.h"

namespace {

const char kGoodAnswer[] = R"([
  {"name": "  Resolved FM ", "url": "http://directory/redirect", "url_resolved": "http://stream/resolved",
   "bitrate": 128, "tags": "jazz,swing"},
  {"name": "Plain URL", "url": "http://stream/plain", "url_resolved": "", "bitrate": "96", "tags": ""},
  {"name": "", "url": "http://stream/nameless", "bitrate": 64},
  {"name": "No URL", "bitrate": 64},
  "not a station",
  {"name": "Zero Rate", "url": "http://stream/zero", "bitrate": 0}
])";

class RadioFetchTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    httplib::Server server;
    std::thread serverThread;
    int port = 0;
    std::mutex lock;
    std::vector<std::string> targets;  // request targets seen
    std::atomic<int> hits{0};

    void SetUp() override
    {
        auto record = [this](const httplib::Request &req) {
            std::lock_guard<std::mutex> g(lock);
            targets.push_back(req.target);
            hits++;
        };
        server.Get("/good/.*", [record](const httplib::Request &req, httplib::Response &res) {
            record(req);
            res.set_content(kGoodAnswer, "application/json");
        });
        server.Get("/garbage/.*", [record](const httplib::Request &req, httplib::Response &res) {
            record(req);
            res.set_content("<html>busy</html>", "text/html");
        });
        server.Get("/object/.*", [record](const httplib::Request &req, httplib::Response &res) {
            record(req);
            res.set_content("{\"stations\": []}", "application/json");
        });
        server.Get("/error/.*", [record](const httplib::Request &req, httplib::Response &res) {
            record(req);
            res.status = 500;
            res.set_content("[]", "application/json");
        });
        server.Get("/big/.*", [record](const httplib::Request &req, httplib::Response &res) {
            record(req);
            std::string body = "[";
            body += std::string(5 * 1024 * 1024, ' ');
            body += "]";
            res.set_content(body, "application/json");
        });
        server.Get("/slow/.*", [record](const httplib::Request &req, httplib::Response &res) {
            record(req);
            std::this_thread::sleep_for(std::chrono::milliseconds(3000));
            res.set_content("[]", "application/json");
        });
        port = server.bind_to_any_port("127.0.0.1");
        ASSERT_GT(port, 0);
        serverThread = std::thread([this] { server.listen_after_bind(); });
        for (int i = 0; i < 200 && !server.is_running(); i++)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        ASSERT_TRUE(server.is_running());
    }

    void TearDown() override
    {
        server.stop();
        if (serverThread.joinable())
            serverThread.join();
    }

    void UseDirectory(const std::string &base, int timeout = 1)
    {
        ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "audio_volume=40\nradio_directory_url=" + base +
                                                     "\nradio_directory_timeout=" +
                                                     std::to_string(timeout) + "\n"));
    }
    std::string Base(const char *kind)
    {
        return "http://127.0.0.1:" + std::to_string(port) + "/" + kind;
    }
    std::string LastTarget()
    {
        std::lock_guard<std::mutex> g(lock);
        return targets.empty() ? std::string() : targets.back();
    }
    void Age(const char *fixedPath, long age)
    {
        struct utimbuf t;
        t.actime = t.modtime = time(nullptr) - age;
        ASSERT_EQ(0, utime(h.Path(fixedPath).c_str(), &t));
    }
};

const char kRadioio[] = "/usr/tarn/etc/audio/radio/radioio.json";

TEST_F(RadioFetchTest, GoodAnswerBecomesTheRadioioList)
{
    UseDirectory(Base("good") + "/");  // a trailing slash is tolerated
    Json::Value list;
    ASSERT_EQ(0, RadioioListGet(list, false));
    EXPECT_EQ(1, hits.load());
    EXPECT_EQ("/good/json/stations/topclick/100?hidebroken=true", LastTarget());

    ASSERT_EQ(3u, list["stations"].size());
    EXPECT_EQ(3, list["total"].asInt());
    const Json::Value &s0 = list["stations"][0];
    EXPECT_EQ("Resolved FM", s0["name"].asString());
    EXPECT_EQ("http://stream/resolved", s0["url"].asString());
    EXPECT_EQ("jazz,swing", s0["desc"].asString());
    EXPECT_EQ(128000, s0["bitrate"].asInt());
    EXPECT_EQ("http://stream/plain", list["stations"][1]["url"].asString());
    EXPECT_EQ(96000, list["stations"][1]["bitrate"].asInt());
    EXPECT_EQ("Zero Rate", list["stations"][2]["name"].asString());
    EXPECT_EQ(0, list["stations"][2]["bitrate"].asInt());

    // The file keeps kilobits per second as text.
    Json::Value file;
    Json::Reader reader;
    ASSERT_TRUE(reader.parse(h.ReadFile(kRadioio), file));
    EXPECT_EQ("128", file["stations"][0]["bitrate"].asString());
    EXPECT_EQ(3, file["total"].asInt());
}

TEST_F(RadioFetchTest, FetchedAgainOnlyWhenADayOldOrForced)
{
    UseDirectory(Base("good"));
    Json::Value list;
    ASSERT_EQ(0, RadioioListGet(list, false));
    ASSERT_EQ(1, hits.load());
    ASSERT_EQ(0, RadioioListGet(list, false));
    EXPECT_EQ(1, hits.load());
    Age(kRadioio, 86399);
    ASSERT_EQ(0, RadioioListGet(list, false));
    EXPECT_EQ(1, hits.load());
    Age(kRadioio, 86400);
    ASSERT_EQ(0, RadioioListGet(list, false));
    EXPECT_EQ(2, hits.load());
    ASSERT_EQ(0, RadioioListGet(list, true));
    EXPECT_EQ(3, hits.load());
}

TEST_F(RadioFetchTest, GenreListsUseTheQueryText)
{
    UseDirectory(Base("good"));
    Json::Value list;
    ASSERT_EQ(0, ShoutcastListGetByGenre("Hip Hop", list, false));
    EXPECT_EQ("/good/json/stations/bytag/Hip%20Hop?limit=100&hidebroken=true&order=clickcount&reverse=true",
              LastTarget());
    EXPECT_TRUE(h.Exists("/usr/tarn/etc/audio/radio/shoutcast_Hip Hop.json"));
    EXPECT_EQ(3u, list["stations"].size());

    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "radio_directory_url=" + Base("good") +
                                                 "\nradio_directory_limit=7\n"));
    ASSERT_EQ(0, ShoutcastListGet(18, list, true));
    EXPECT_EQ(0u, LastTarget().find("/good/json/stations/bytag/RnB?limit=7&"));
    EXPECT_TRUE(h.Exists("/usr/tarn/etc/audio/radio/shoutcast_R&B.json"));

    EXPECT_EQ(-1, MediaServer::RadioUpdateShoutcastByGenre("shoutcast_Easy"));
    EXPECT_EQ(-1, MediaServer::RadioUpdateShoutcastByGenre("Rock"));
    EXPECT_EQ(0, MediaServer::RadioUpdateShoutcastByGenre("shoutcast_Rock"));
}

TEST_F(RadioFetchTest, FailedFetchesWriteNothing)
{
    struct Case {
        const char *kind;
        const char *log;
    } cases[] = {
        {"garbage", "is not a station list"},
        {"object", "is not a station list"},
        {"error", "HTTP status 500"},
        {"big", "is larger than"},
        {"slow", "Failed to fetch"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.kind);
        UseDirectory(Base(c.kind));
        h.ClearLog();
        auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(-1, MediaServer::RadioUpdateRadioio());
        double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
        EXPECT_LT(seconds, 2.9);  // the 1 s limit ends the slow answer early
        EXPECT_EQ(1, h.CountLog(c.log)) << h.Log();
        EXPECT_FALSE(h.Exists(kRadioio));
        Json::Value list;
        EXPECT_EQ(-1, RadioioListGet(list, false));
    }

    // A stale list survives a failed refresh unchanged and is still read.
    const std::string old = "{\"stations\": [{\"name\": \"Old\", \"url\": \"http://old\"}], \"total\": 1}";
    ASSERT_EQ(0, h.WriteFile(kRadioio, old));
    Age(kRadioio, 2 * 86400);
    UseDirectory(Base("garbage"));
    Json::Value list;
    ASSERT_EQ(0, RadioioListGet(list, false));
    EXPECT_EQ("Old", list["stations"][0]["name"].asString());
    EXPECT_EQ(old, h.ReadFile(kRadioio));
}

TEST_F(RadioFetchTest, UnreachableDirectories)
{
    // A listener that never accepts: the connection is made by the kernel
    // but no answer ever comes; the total time-out ends the wait.
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    ASSERT_GE(fd, 0);
    sockaddr_in addr = {};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(0, bind(fd, reinterpret_cast<sockaddr *>(&addr), sizeof(addr)));
    ASSERT_EQ(0, listen(fd, 4));
    socklen_t len = sizeof(addr);
    ASSERT_EQ(0, getsockname(fd, reinterpret_cast<sockaddr *>(&addr), &len));
    int silentPort = ntohs(addr.sin_port);

    UseDirectory("http://127.0.0.1:" + std::to_string(silentPort));
    h.ClearLog();
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(-1, MediaServer::RadioUpdateRadioio());
    double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    EXPECT_GE(seconds, 0.5);
    EXPECT_LT(seconds, 5.0);
    EXPECT_EQ(1, h.CountLog("Failed to fetch"));
    close(fd);

    // Nothing listens any more: refused at once.
    h.ClearLog();
    EXPECT_EQ(-1, MediaServer::RadioUpdateRadioio());
    EXPECT_EQ(1, h.CountLog("Failed to fetch"));

    // Not an HTTP URL, and no URL at all.
    UseDirectory("file:///etc");
    EXPECT_EQ(-1, MediaServer::RadioUpdateRadioio());
    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "audio_volume=40\n"));
    h.ClearLog();
    EXPECT_EQ(-1, MediaServer::RadioUpdateRadioio());
    EXPECT_EQ(0, h.CountLog("Failed to fetch"));
    EXPECT_FALSE(h.Exists(kRadioio));
}

TEST(RadioDirectoryAnswer, ConvertsOnlyArraysOfStations)
{
    Json::Value list;
    EXPECT_EQ(-1, RadioDirectoryToList("", list));
    EXPECT_EQ(-1, RadioDirectoryToList("{}", list));
    EXPECT_EQ(-1, RadioDirectoryToList("[1,", list));
    ASSERT_EQ(0, RadioDirectoryToList("[]", list));
    EXPECT_EQ(0u, list["stations"].size());
    EXPECT_EQ(0, list["total"].asInt());
    ASSERT_EQ(0, RadioDirectoryToList(R"([{"name": "A", "url": "http://a", "bitrate": 320.0},
        {"name": 5, "url": "http://b"}, {"name": "C", "url": ["x"]}])", list));
    ASSERT_EQ(1u, list["stations"].size());
    EXPECT_EQ("320", list["stations"][0]["bitrate"].asString());
    EXPECT_EQ("", list["stations"][0]["desc"].asString());
}

}  // namespace
