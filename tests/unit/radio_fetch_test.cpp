// Radio directory updaters against a directory served on 127.0.0.1 by the
// test itself: good answers, garbage, nesting deep enough to exhaust a
// recursive parser, errors, oversized, slow and no answers.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <ctime>
#include <string>
#include <thread>
#include <utime.h>

#include <httplib.h>

#include "tests/unit/loopback_http.h"
#include <json/json.h>

#include "daemon/tarn_types.h"
#include "source/radio_fetch.h"
#include "source/radiolist.h"
#include "tests/harness/harness.h"

namespace {

const char kRadioio[] = "/usr/tarn/etc/audio/radio/radioio.json";
const char kGoodAnswer[] = R"([
  {"name": "  Resolved FM ", "url": "http://directory/redirect", "url_resolved": "http://stream/resolved",
   "bitrate": 128, "tags": "jazz,swing"},
  {"name": "Plain URL", "url": "http://stream/plain", "url_resolved": "", "bitrate": "96", "tags": ""},
  {"name": "", "url": "http://stream/nameless", "bitrate": 64},
  {"name": "No URL", "bitrate": 64}, "not a station", {"name": 5, "url": "http://b"},
  {"name": "Zero Rate", "url": "http://stream/zero", "bitrate": 0}
])";

class RadioFetchTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    LoopbackHttp http;
    httplib::Server &server = http.server;
    std::atomic<int> hits{0};
    std::string lastTarget;  // written by the server thread before hits grows

    void SetUp() override
    {
        server.Get("/(\\w+)/.*", [this](const httplib::Request &req, httplib::Response &res) {
            lastTarget = req.target;
            hits++;
            std::string kind = req.matches[1];
            if (kind == "good")
                res.set_content(kGoodAnswer, "application/json");
            else if (kind == "garbage")
                res.set_content("<html>busy</html>", "text/html");
            else if (kind == "object")
                res.set_content("{\"stations\": []}", "application/json");
            else if (kind == "nested")
                res.set_content(std::string(5000, '['), "application/json");
            else if (kind == "big")
                res.set_content("[" + std::string(5 * 1024 * 1024, ' ') + "]", "application/json");
            else if (kind == "slow")
                std::this_thread::sleep_for(std::chrono::milliseconds(3000));
            else
                res.status = 500;
        });
        base = http.Start();
        ASSERT_NE("", base) << "no server on 127.0.0.1";
        base += "/";
    }
    void TearDown() override { http.Stop(); }
    void UseDirectory(const std::string &url)
    {
        ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "radio_directory_url=" + url + "\nradio_directory_timeout=1\n"));
    }
    void Age(long age)
    {
        struct utimbuf t;
        t.actime = t.modtime = time(nullptr) - age;
        ASSERT_EQ(0, utime(h.Path(kRadioio).c_str(), &t));
    }
    std::string base;
};

TEST_F(RadioFetchTest, GoodAnswerIsFetchedOnlyWhenADayOldOrForced)
{
    UseDirectory(base + "good/");  // a trailing slash is tolerated
    Json::Value list;
    ASSERT_EQ(0, RadioioListGet(list, false));
    EXPECT_EQ("/good/json/stations/topclick/100?hidebroken=true", lastTarget);
    // Stations without a URL or name, or not objects, are left out; names
    // trimmed; the resolved URL wins; kbit/s become bit/s; tags the desc.
    std::string got = std::to_string(list["total"].asInt());
    for (const Json::Value &st : list["stations"])
        got += "|" + st["name"].asString() + ";" + st["url"].asString() + ";" + st["desc"].asString() + ";" +
               std::to_string(st["bitrate"].asInt());
    EXPECT_EQ("3|Resolved FM;http://stream/resolved;jazz,swing;128000|Plain URL;http://stream/plain;;96000|"
              "Zero Rate;http://stream/zero;;0", got);
    Json::Value file;  // the file keeps kilobits per second as text
    ASSERT_TRUE(Json::Reader().parse(h.ReadFile(kRadioio), file));
    EXPECT_EQ("128", file["stations"][0]["bitrate"].asString());

    struct Step { long age; bool force; int hits; } steps[] = {
        {0, false, 1}, {86399, false, 1}, {86400, false, 2}, {0, true, 3}};
    for (const Step &s : steps) {
        Age(s.age);
        ASSERT_EQ(0, RadioioListGet(list, s.force));
        EXPECT_EQ(s.hits, hits.load()) << "age " << s.age << " force " << s.force;
    }

    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "radio_directory_url=" + base + "good\nradio_directory_limit=7\n"));
    ASSERT_EQ(0, ShoutcastListGetByGenre("Hip Hop", list, true));
    EXPECT_EQ("/good/json/stations/bytag/Hip%20Hop?limit=7&hidebroken=true&order=clickcount&reverse=true",
              lastTarget);
    EXPECT_TRUE(h.Exists("/usr/tarn/etc/audio/radio/shoutcast_Hip Hop.json"));
    EXPECT_EQ(-1, MediaServer::RadioUpdateShoutcastByGenre("Rock"));
    EXPECT_EQ(0, MediaServer::RadioUpdateShoutcastByGenre("shoutcast_Rock"));
}

TEST_F(RadioFetchTest, FailedFetchesWriteNothing)
{
    // "slow" answers after 3 s, like a server that accepts and never answers:
    // the 1 s limit ends the wait. Nothing listens on port 1.
    struct Case { std::string url; const char *log; } cases[] = {
        {base + "garbage", "is not a station list"}, {base + "object", "is not a station list"},
        {base + "nested", "is not a station list"},
        {base + "error", "HTTP status 500"}, {base + "big", "is larger than"},
        {base + "slow", "Failed to fetch"}, {"http://127.0.0.1:1", "Failed to fetch"}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.url);
        UseDirectory(c.url);
        h.ClearLog();
        auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(-1, MediaServer::RadioUpdateRadioio());
        EXPECT_LT(std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count(), 2.9);
        EXPECT_EQ(1, h.CountLog(c.log)) << h.Log();
        EXPECT_FALSE(h.Exists(kRadioio));
    }

    // A stale list survives a failed refresh unchanged and is still read.
    const std::string old = "{\"stations\": [{\"name\": \"Old\", \"url\": \"http://old\"}], \"total\": 1}";
    ASSERT_EQ(0, h.WriteFile(kRadioio, old));
    Age(2 * 86400);
    UseDirectory(base + "garbage");
    Json::Value list;
    ASSERT_EQ(0, RadioioListGet(list, false));
    EXPECT_EQ("Old", list["stations"][0]["name"].asString());
    EXPECT_EQ(old, h.ReadFile(kRadioio));
}

}  // namespace
