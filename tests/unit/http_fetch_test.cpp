// The bounded download against a server on 127.0.0.1 run by the test itself:
// statuses handed back, the body limit, redirects only when asked for,
// the User-Agent, and the ways a transfer ends early.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <string>
#include <thread>

#include <httplib.h>

#include "tests/unit/loopback_http.h"

#include "platform/http_fetch.h"

namespace {

class HttpFetchTest : public ::testing::Test {
protected:
    LoopbackHttp http;
    httplib::Server &server = http.server;
    std::string base;
    std::string lastAgent;  // written by the server thread before it answers

    void SetUp() override
    {
        server.Get("/body/(\\d+)", [](const httplib::Request &req, httplib::Response &res) {
            res.set_content(std::string(std::stoul(req.matches[1]), 'x'), "text/plain");
        });
        server.Get("/missing", [](const httplib::Request &, httplib::Response &res) {
            res.status = 404;
            res.set_content("gone", "text/plain");
        });
        server.Get("/moved", [](const httplib::Request &, httplib::Response &res) {
            res.set_redirect("/body/3");
        });
        server.Get("/agent", [this](const httplib::Request &req, httplib::Response &res) {
            lastAgent = req.get_header_value("User-Agent");
            res.set_content("ok", "text/plain");
        });
        server.Get("/slow", [](const httplib::Request &, httplib::Response &res) {
            std::this_thread::sleep_for(std::chrono::milliseconds(2500));
            res.set_content("late", "text/plain");
        });
        base = http.Start();
        ASSERT_NE("", base) << "no server on 127.0.0.1";
    }
    void TearDown() override { http.Stop(); }
    static HttpFetchOptions Options()
    {
        HttpFetchOptions o;
        o.maxBytes = 100;
        o.connectTimeoutSeconds = 1;
        o.timeoutSeconds = 1;
        return o;
    }
};

TEST_F(HttpFetchTest, StatusesAndTheBodyLimit)
{
    std::string body = "stale";
    HttpFetchResult r;
    ASSERT_EQ(0, HttpFetch(base + "/body/100", Options(), &body, &r));
    EXPECT_EQ(200, r.status);
    EXPECT_EQ(HTTP_FETCH_OK, r.error);
    EXPECT_EQ(std::string(100, 'x'), body);

    // A status other than 200 is the caller's to judge.
    ASSERT_EQ(0, HttpFetch(base + "/missing", Options(), &body, &r));
    EXPECT_EQ(404, r.status);
    EXPECT_EQ("gone", body);

    // One byte over the limit: refused, nothing kept.
    EXPECT_EQ(-1, HttpFetch(base + "/body/101", Options(), &body, &r));
    EXPECT_EQ(HTTP_FETCH_TOO_LARGE, r.error);
    EXPECT_TRUE(body.empty());
    // Far over it (the announced length alone refuses it).
    EXPECT_EQ(-1, HttpFetch(base + "/body/100000", Options(), &body, &r));
    EXPECT_EQ(HTTP_FETCH_TOO_LARGE, r.error);
    EXPECT_TRUE(body.empty());
}

TEST_F(HttpFetchTest, RedirectsAndUserAgent)
{
    std::string body;
    HttpFetchResult r;
    HttpFetchOptions o = Options();
    ASSERT_EQ(0, HttpFetch(base + "/moved", o, &body, &r));
    EXPECT_EQ(302, r.status);
    o.maxRedirects = 1;
    ASSERT_EQ(0, HttpFetch(base + "/moved", o, &body, &r));
    EXPECT_EQ(200, r.status);
    EXPECT_EQ("xxx", body);

    o.userAgent = "tester/2";
    ASSERT_EQ(0, HttpFetch(base + "/agent", o, &body, &r));
    EXPECT_EQ("tester/2", lastAgent);
}

TEST_F(HttpFetchTest, TransfersThatEndEarly)
{
    std::string body;
    HttpFetchResult r;
    HttpFetchOptions o = Options();

    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(-1, HttpFetch(base + "/slow", o, &body, &r));
    EXPECT_EQ(HTTP_FETCH_TIMEOUT, r.error);
    EXPECT_FALSE(r.message.empty());
    EXPECT_LT(std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count(), 2.0);

    std::atomic<bool> abort{true};
    o.abort = &abort;
    o.timeoutSeconds = 5;
    start = std::chrono::steady_clock::now();
    EXPECT_EQ(-1, HttpFetch(base + "/slow", o, &body, &r));
    EXPECT_EQ(HTTP_FETCH_ABORTED, r.error);
    EXPECT_LT(std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count(), 2.0);
    abort = false;
    EXPECT_EQ(0, HttpFetch(base + "/agent", o, &body, &r));

    // Nothing listens on port 1.
    EXPECT_EQ(-1, HttpFetch("http://127.0.0.1:1/", Options(), &body, &r));
    EXPECT_EQ(HTTP_FETCH_CONNECT, r.error);
    // A protocol outside the list.
    EXPECT_EQ(-1, HttpFetch("ftp://127.0.0.1:1/", Options(), &body, &r));
    EXPECT_EQ(HTTP_FETCH_BAD_URL, r.error);
}

}  // namespace
