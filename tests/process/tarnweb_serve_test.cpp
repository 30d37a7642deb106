// The song server on 127.0.0.1: library songs by token, USB files by path,
// byte ranges, HEAD, refusals and several downloads at once.
#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <random>
#include <thread>

#include "platform/media_id.h"
#include "tests/harness/harness.h"
#include "tests/process/tarnweb_test_util.h"

using tarnwebtest::Fetch;
using tarnwebtest::HttpResult;

namespace {

const int kPort = 18080;
const char kBase[] = "http://127.0.0.1:18080/audio/webUI/audiotransfer.cgi/";

class TarnwebTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
        h.reset(new tarntest::Harness);
        std::string error;
        songs = tarnwebtest::MakeLibrary(*h, "/music", 2, &error);
        ASSERT_EQ(3u, songs.size()) << error;
        usbRoot = h->Path("/media/usb");
        ASSERT_EQ(0, h->WriteFile("/media/usb/disk1/sub/song.mp3", RandomBytes(300000)));
        ASSERT_EQ(0, h->WriteFile("/media/usb/disk1/Big Song (live).flac", RandomBytes(4 << 20)));
        ASSERT_EQ(0, h->WriteFile("/media/usb/disk1/empty.mp3", ""));
        ASSERT_EQ(0, h->WriteFile("/private/secret.mp3", "not for renderers"));
        ASSERT_EQ(0, symlink(h->Path("/private/secret.mp3").c_str(),
                             h->Path("/media/usb/disk1/link.mp3").c_str()));
        ASSERT_EQ(0, symlink(h->Path("/private").c_str(), h->Path("/media/usb/disk1/dirlink").c_str()));
        ASSERT_EQ(0, h->WriteFile("/etc/tarninfo.conf", "admin_port=18080\n"));
        server.reset(new tarnwebtest::SongServerProcess(*h));
    }
    void TearDown() override
    {
        if (server && server->Pid() > 0) {
            EXPECT_EQ(0, server->Stop());
        }
        server.reset();
        h.reset();
    }
    void StartServer(std::vector<std::string> args = {})
    {
        args.push_back("--bind");
        args.push_back("127.0.0.1");
        ASSERT_TRUE(server->Start(args, "127.0.0.1", kPort)) << "tarnweb did not listen on " << kPort;
    }
    static std::string RandomBytes(size_t n)
    {
        std::mt19937 gen(static_cast<unsigned>(n));
        std::string s(n, '\0');
        for (char &c : s)
            c = static_cast<char>(gen());
        return s;
    }
    std::string TokenUrl(const MediaSong &song, const std::string &ext)
    {
        return kBase + MediaIDEncryption(song.id) + "." + ext;
    }
    std::string UsbUrl(const std::string &path, const std::string &ext = "mp3")
    {
        return std::string(kBase) + "ipod/" + tarnwebtest::Hex(path) + "." + ext;
    }
    const MediaSong *SongWithExt(const std::string &ext)
    {
        for (const MediaSong &s : songs)
            if (s.path.size() > ext.size() && s.path.substr(s.path.size() - ext.size()) == ext)
                return &s;
        return nullptr;
    }

    std::unique_ptr<tarntest::Harness> h;
    std::unique_ptr<tarnwebtest::SongServerProcess> server;
    std::vector<MediaSong> songs;
    std::string usbRoot;
};

TEST_F(TarnwebTest, LibrarySongsByTokenWithTypeAndDlnaHeaders)
{
    StartServer();
    struct {
        const char *ext, *mime;
    } kinds[] = {{"mp3", "audio/mpeg"}, {"flac", "audio/flac"}, {"ogg", "audio/ogg"}};
    for (auto &k : kinds) {
        const MediaSong *song = SongWithExt(k.ext);
        ASSERT_NE(nullptr, song) << k.ext;
        HttpResult r = Fetch(TokenUrl(*song, k.ext));
        ASSERT_EQ(200, r.status) << r.error;
        EXPECT_EQ(tarnwebtest::ReadAll(song->path), r.body) << song->path;
        EXPECT_EQ(k.mime, r.headers["content-type"]);
        EXPECT_EQ("bytes", r.headers["accept-ranges"]);
        EXPECT_EQ("Streaming", r.headers["transfermode.dlna.org"]);
        EXPECT_NE(std::string::npos, r.headers["contentfeatures.dlna.org"].find("DLNA.ORG_OP=01"));
        EXPECT_NE(std::string::npos, r.headers["contentfeatures.dlna.org"].find("DLNA.ORG_FLAGS="));
    }
    // The type comes from the file, not from what the URL claims.
    const MediaSong *flac = SongWithExt("flac");
    HttpResult r = Fetch(TokenUrl(*flac, "txt"));
    EXPECT_EQ(200, r.status);
    EXPECT_EQ("audio/flac", r.headers["content-type"]);
}

TEST_F(TarnwebTest, HeadGivesTheHeadersOfGetWithoutBody)
{
    StartServer();
    const MediaSong *mp3 = SongWithExt("mp3");
    HttpResult head = Fetch(TokenUrl(*mp3, "mp3"), "", true);
    ASSERT_EQ(200, head.status) << head.error;
    EXPECT_EQ("", head.body);
    EXPECT_EQ(std::to_string(tarnwebtest::ReadAll(mp3->path).size()), head.headers["content-length"]);
    EXPECT_EQ("audio/mpeg", head.headers["content-type"]);
    EXPECT_EQ("Streaming", head.headers["transfermode.dlna.org"]);

    HttpResult usbHead = Fetch(UsbUrl(usbRoot + "/disk1/sub/song.mp3"), "", true);
    EXPECT_EQ(200, usbHead.status);
    EXPECT_EQ("300000", usbHead.headers["content-length"]);
    HttpResult badHead = Fetch(std::string(kBase) + std::string(32, 'a') + ".mp3", "", true);
    EXPECT_EQ(404, badHead.status);
}

TEST_F(TarnwebTest, ByteRangesPartialSuffixOpenEndedClampedAndPastTheEnd)
{
    StartServer();
    std::string path = usbRoot + "/disk1/sub/song.mp3";
    std::string data = tarnwebtest::ReadAll(path);
    std::string url = UsbUrl(path);

    HttpResult r = Fetch(url, "100-199");
    ASSERT_EQ(206, r.status) << r.error;
    EXPECT_EQ(data.substr(100, 100), r.body);
    EXPECT_EQ("bytes 100-199/300000", r.headers["content-range"]);

    r = Fetch(url, "-50");
    EXPECT_EQ(206, r.status);
    EXPECT_EQ(data.substr(300000 - 50), r.body);
    EXPECT_EQ("bytes 299950-299999/300000", r.headers["content-range"]);

    r = Fetch(url, "299990-");
    EXPECT_EQ(206, r.status);
    EXPECT_EQ(data.substr(299990), r.body);

    r = Fetch(url, "299000-5000000");  // end past the file: cut at the end
    EXPECT_EQ(206, r.status);
    EXPECT_EQ(data.substr(299000), r.body);
    EXPECT_EQ("bytes 299000-299999/300000", r.headers["content-range"]);

    r = Fetch(url, "300000-");
    EXPECT_EQ(416, r.status);
    EXPECT_EQ("bytes */300000", r.headers["content-range"]);
    r = Fetch(url, "400000-500000");
    EXPECT_EQ(416, r.status);

    r = Fetch(url, "0-9,20-29");
    EXPECT_EQ(206, r.status);
    EXPECT_EQ(0u, r.headers["content-type"].rfind("multipart/byteranges", 0)) << r.headers["content-type"];
    EXPECT_NE(std::string::npos, r.body.find(data.substr(20, 10)));

    // An empty file: whole is fine, any range is not satisfiable.
    std::string empty = UsbUrl(usbRoot + "/disk1/empty.mp3");
    r = Fetch(empty);
    EXPECT_EQ(200, r.status);
    EXPECT_EQ("", r.body);
    r = Fetch(empty, "0-10");
    EXPECT_EQ(416, r.status);

    // A range on a refused resource is still a plain 404.
    r = Fetch(std::string(kBase) + std::string(32, 'b') + ".mp3", "5-10");
    EXPECT_EQ(404, r.status);
}

TEST_F(TarnwebTest, BadTokensAreNotFoundAndLogged)
{
    StartServer();
    const MediaSong *mp3 = SongWithExt("mp3");
    std::string token = MediaIDEncryption(mp3->id);
    std::string altered = token;
    altered[5] = altered[5] == 'a' ? 'b' : 'a';
    uint32_t missingId = 0;
    for (const MediaSong &s : songs)
        missingId = std::max(missingId, s.id);
    missingId += 1000;

    h->ClearLog();
    EXPECT_EQ(404, Fetch(std::string(kBase) + altered + ".mp3").status);
    EXPECT_EQ(404, Fetch(std::string(kBase) + std::string(32, '0') + ".mp3").status);
    EXPECT_EQ(404, Fetch(std::string(kBase) + "nothex-nothex.mp3").status);
    EXPECT_EQ(404, Fetch(std::string(kBase) + token).status);  // no extension
    EXPECT_EQ(404, Fetch(std::string(kBase) + token + "x.mp3").status);
    EXPECT_EQ(404, Fetch(kBase + MediaIDEncryption(missingId) + ".mp3").status);
    EXPECT_EQ(404, Fetch("http://127.0.0.1:18080/elsewhere").status);
    EXPECT_GE(h->CountLog("Bad song token"), 3) << h->Log();
    EXPECT_EQ(1, h->CountLog("not in the library")) << h->Log();
    EXPECT_EQ(1, h->CountLog("No such resource")) << h->Log();
    // The good token still works afterwards.
    EXPECT_EQ(200, Fetch(std::string(kBase) + token + ".mp3").status);
}

TEST_F(TarnwebTest, PathFormServesOnlyRegularFilesBelowTheUsbRoot)
{
    StartServer();
    EXPECT_EQ(200, Fetch(UsbUrl(usbRoot + "/disk1/sub/song.mp3")).status);
    EXPECT_EQ(206, Fetch(UsbUrl(usbRoot + "/disk1/Big Song (live).flac", "flac"), "0-0").status);
    h->ClearLog();
    const std::string refused[] = {
        usbRoot + "/../private/secret.mp3",
        usbRoot + "/disk1/../../private/secret.mp3",
        usbRoot + "/disk1/sub/../sub/song.mp3",  // ".." refused even when it stays inside
        usbRoot + "/disk1/link.mp3",           // link to a file outside
        usbRoot + "/disk1/dirlink/secret.mp3", // through a linked folder
        h->Path("/private/secret.mp3"),
        "/etc/passwd",
        usbRoot + "/disk1/sub",                // a folder
        usbRoot + "/disk1/missing.mp3",
        usbRoot,
        usbRoot + "x/song.mp3",
        "relative/song.mp3",
    };
    for (const std::string &p : refused) {
        HttpResult r = Fetch(UsbUrl(p));
        EXPECT_EQ(404, r.status) << p;
        EXPECT_EQ(std::string::npos, r.body.find("not for renderers")) << p;
    }
    // Malformed hex: odd length, a NUL byte, not hex, and raw traversal in
    // the URL itself.
    std::string good = tarnwebtest::Hex(usbRoot + "/disk1/sub/song.mp3");
    EXPECT_EQ(404, Fetch(std::string(kBase) + "ipod/" + good.substr(1) + ".mp3").status);
    EXPECT_EQ(404, Fetch(std::string(kBase) + "ipod/" + good + "00.mp3").status);
    EXPECT_EQ(404, Fetch(std::string(kBase) + "ipod/zz" + good + ".mp3").status);
    EXPECT_EQ(404, Fetch(std::string(kBase) + "ipod/../../../etc/passwd").status);
    EXPECT_EQ(404, Fetch(std::string(kBase) + "ipod/..%2f..%2fetc%2fpasswd.mp3").status);
    EXPECT_GE(h->CountLog("Refused path"), 8) << h->Log();
}

TEST_F(TarnwebTest, UsbRootFromTheConfigurationAndPortFromOptions)
{
    ASSERT_EQ(0, h->WriteFile("/etc/tarninfo.conf",
                              "admin_port=18080\nusb_mount_root=" + h->Path("/private") + "\n"));
    StartServer();
    HttpResult r = Fetch(UsbUrl(h->Path("/private/secret.mp3")));
    EXPECT_EQ(200, r.status);
    EXPECT_EQ("not for renderers", r.body);
    EXPECT_EQ(404, Fetch(UsbUrl(usbRoot + "/disk1/sub/song.mp3")).status);
    EXPECT_EQ(0, server->Stop());

    // --port wins over admin_port.
    server.reset(new tarnwebtest::SongServerProcess(*h));
    ASSERT_TRUE(server->Start({"--port", "18081", "--bind", "127.0.0.1"}, "127.0.0.1", 18081));
    EXPECT_FALSE(tarnwebtest::WaitListening("127.0.0.1", kPort, 200));
}

TEST_F(TarnwebTest, NoPortAnywhereIsAClearStartError)
{
    ASSERT_EQ(0, h->WriteFile("/etc/tarninfo.conf", "audio_volume=50\n"));
    std::string out;
    EXPECT_EQ(2, h->Run({tarntest::BinPath("tarnweb")}, &out, 10000));
    EXPECT_NE(std::string::npos, out.find("admin_port")) << out;
    EXPECT_EQ(2, h->Run({tarntest::BinPath("tarnweb"), "--threads", "0"}, &out, 10000));
    EXPECT_EQ(2, h->Run({tarntest::BinPath("tarnweb"), "--bogus"}, &out, 10000));
}

TEST_F(TarnwebTest, ConcurrentDownloadsWithFewerWorkersThanClients)
{
    StartServer({"--threads", "2"});
    std::string path = usbRoot + "/disk1/Big Song (live).flac";
    std::string data = tarnwebtest::ReadAll(path);
    std::string url = UsbUrl(path, "flac");
    const MediaSong *ogg = SongWithExt("ogg");
    std::string oggData = tarnwebtest::ReadAll(ogg->path);
    std::string oggUrl = TokenUrl(*ogg, "ogg");

    const int kClients = 6;
    std::atomic<int> good(0);
    std::vector<std::string> problems(kClients);
    std::vector<std::thread> threads;
    for (int i = 0; i < kClients; ++i) {
        threads.emplace_back([&, i] {
            for (int round = 0; round < 2; ++round) {
                HttpResult r;
                bool ok;
                if (i % 3 == 2) {
                    r = Fetch(oggUrl);
                    ok = r.status == 200 && r.body == oggData;
                } else if (i % 3 == 1) {
                    size_t from = static_cast<size_t>(i) * 100000;
                    r = Fetch(url, std::to_string(from) + "-");
                    ok = r.status == 206 && r.body == data.substr(from);
                } else {
                    r = Fetch(url);
                    ok = r.status == 200 && r.body == data;
                }
                if (ok)
                    ++good;
                else
                    problems[i] = "status " + std::to_string(r.status) + " " + r.error +
                                  " bytes " + std::to_string(r.body.size());
            }
        });
    }
    for (std::thread &t : threads)
        t.join();
    for (int i = 0; i < kClients; ++i)
        EXPECT_EQ("", problems[i]) << "client " << i;
    EXPECT_EQ(2 * kClients, good.load());
    // Still serving afterwards.
    EXPECT_EQ(200, Fetch(UsbUrl(usbRoot + "/disk1/sub/song.mp3")).status);
}

}  // namespace
