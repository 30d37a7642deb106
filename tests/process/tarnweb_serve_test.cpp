// The song server on 127.0.0.1: library songs by token, USB files by path,
// byte ranges, HEAD and refusals.
#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <curl/curl.h>

#include "platform/media_id.h"
#include "tests/process/tarnweb_test_util.h"

namespace {

const char kBase[] = "http://127.0.0.1:18080/audio/webUI/audiotransfer.cgi/";
const char *g_from = "127.0.0.1";  // the address requests come from

size_t Append(char *data, size_t size, size_t n, void *out)
{
    static_cast<std::string *>(out)->append(data, size * n);
    return size * n;
}

struct Reply {
    long status = 0;
    std::string head, body;
    std::string Header(const std::string &name)  // name in lower case; "" when absent
    {
        std::string lower = head;
        for (char &c : lower)
            c = static_cast<char>(tolower(c));
        size_t at = lower.find("\r\n" + name + ": "), from = at + name.size() + 4;
        return at == std::string::npos ? "" : head.substr(from, head.find("\r\n", from) - from);
    }
};

// One request; range is the Range header without "bytes=".
Reply Fetch(const std::string &url, const std::string &range = "", bool head = false)
{
    Reply r;
    CURL *c = curl_easy_init();
    curl_easy_setopt(c, CURLOPT_URL, url.c_str());
    curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, Append);
    curl_easy_setopt(c, CURLOPT_WRITEDATA, &r.body);
    curl_easy_setopt(c, CURLOPT_HEADERFUNCTION, Append);
    curl_easy_setopt(c, CURLOPT_HEADERDATA, &r.head);
    curl_easy_setopt(c, CURLOPT_TIMEOUT, 30L);
    curl_easy_setopt(c, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(c, CURLOPT_PATH_AS_IS, 1L);
    curl_easy_setopt(c, CURLOPT_NOPROXY, "*");
    curl_easy_setopt(c, CURLOPT_RANGE, range.empty() ? nullptr : range.c_str());
    curl_easy_setopt(c, CURLOPT_NOBODY, head ? 1L : 0L);
    curl_easy_setopt(c, CURLOPT_INTERFACE, g_from);
    curl_easy_perform(c);  // a failed transfer leaves status 0
    curl_easy_getinfo(c, CURLINFO_RESPONSE_CODE, &r.status);
    curl_easy_cleanup(c);
    return r;
}

// The URL the daemon hands out for a song named by path.
std::string UsbUrl(const std::string &path, const char *ext = "mp3")
{
    return std::string(kBase) + "ipod/" + MediaPathToken(path) + "." + ext;
}

class TarnwebTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
        std::string error;
        songs = tarnwebtest::MakeLibrary(h, "/music", 2, &error);
        ASSERT_EQ(3u, songs.size()) << error;
        for (size_t i = 0; i < 300000; ++i)  // no two 256-byte blocks alike
            small += static_cast<char>(i ^ (i >> 8) ^ (i >> 16));
        usb = h.Path("/media/usb");
        ASSERT_EQ(0, h.WriteFile("/media/usb/disk1/sub/song.mp3", small));
        ASSERT_EQ(0, h.WriteFile("/media/usb/disk1/empty.mp3", ""));
        ASSERT_EQ(0, h.WriteFile("/private/secret.mp3", "not for renderers"));
        ASSERT_EQ(0, symlink(h.Path("/private/secret.mp3").c_str(), (usb + "/disk1/link.mp3").c_str()));
        ASSERT_EQ(0, h.WriteFile("/etc/tarninfo.conf", "admin_port=18080\n"));
        server = tarnwebtest::StartSongServer(h, {"--bind", "127.0.0.1", "--threads", "2"});
        ASSERT_GT(server, 0) << "tarnweb did not listen on 18080";
    }
    void TearDown() override { EXPECT_TRUE(server == 0 || tarnwebtest::EndChild(h, server) == 0); }
    std::string TokenUrl(int i, const char *ext) { return kBase + MediaIDEncryption(songs[i].id) + "." + ext; }

    tarntest::Harness h;
    pid_t server = 0;
    std::vector<MediaSong> songs;  // mp3, flac, ogg
    std::string usb, small;
};

TEST_F(TarnwebTest, LibrarySongsByTokenHeadAndByteRanges)
{
    const char *mimes[] = {"audio/mpeg", "audio/flac", "audio/ogg"};
    for (int i = 0; i < 3; ++i) {
        Reply r = Fetch(TokenUrl(i, "txt"));  // the type comes from the file, not the URL
        ASSERT_EQ(200, r.status);
        EXPECT_EQ(tarnwebtest::ReadAll(songs[i].path), r.body) << songs[i].path;
        EXPECT_EQ(mimes[i], r.Header("content-type"));
        EXPECT_EQ("bytes", r.Header("accept-ranges"));
        EXPECT_EQ("Streaming", r.Header("transfermode.dlna.org"));
        EXPECT_NE(std::string::npos, r.Header("contentfeatures.dlna.org").find("DLNA.ORG_OP=01"));
        Reply head = Fetch(TokenUrl(i, "mp3"), "", true);
        EXPECT_EQ(200, head.status);
        EXPECT_EQ("", head.body);
        EXPECT_EQ(std::to_string(r.body.size()), head.Header("content-length"));
        EXPECT_EQ(mimes[i], head.Header("content-type"));
    }
    EXPECT_EQ(404, Fetch(std::string(kBase) + std::string(32, 'a') + ".mp3", "", true).status);

    const std::pair<const char *, const char *> cases[] = {  // range, Content-Range
        {"100-199", "bytes 100-199/300000"}, {"-50", "bytes 299950-299999/300000"},
        {"299990-", "bytes 299990-299999/300000"}, {"299000-5000000", "bytes 299000-299999/300000"},
        {"300000-", "bytes */300000"}, {"400000-500000", "bytes */300000"},
        // Ends past any 64-bit number mean "to the end".
        {"0-18446744073709551615", "bytes 0-299999/300000"},
        {"299990-99999999999999999999999", "bytes 299990-299999/300000"}};
    for (auto &c : cases) {
        Reply r = Fetch(UsbUrl(usb + "/disk1/sub/song.mp3"), c.first);
        size_t from = 0, to = 0;
        bool partial = sscanf(c.second, "bytes %zu-%zu", &from, &to) == 2;
        EXPECT_EQ(partial ? 206 : 416, r.status) << c.first;
        EXPECT_EQ(c.second, r.Header("content-range")) << c.first;
        EXPECT_TRUE(!partial || small.substr(from, to + 1 - from) == r.body) << c.first;
    }
    EXPECT_EQ(200, Fetch(UsbUrl(usb + "/disk1/empty.mp3")).status);
    EXPECT_EQ(416, Fetch(UsbUrl(usb + "/disk1/empty.mp3"), "0-10").status);
    EXPECT_EQ(404, Fetch(std::string(kBase) + std::string(32, 'b') + ".mp3", "5-10").status);
}

TEST_F(TarnwebTest, OnlySignedTokensNameAFile)
{
    std::string token = MediaIDEncryption(songs[0].id), altered = token;
    altered[5] = altered[5] == 'a' ? 'b' : 'a';
    const std::string song = usb + "/disk1/sub/song.mp3", signedUrl = UsbUrl(song);
    std::string hex;  // the bare hex path, as unsigned URLs once named files
    char d[3];
    for (unsigned char c : song)
        hex.append(d, snprintf(d, sizeof(d), "%02x", c));
    std::string badMac = signedUrl;
    badMac[badMac.size() - 6] = badMac[badMac.size() - 6] == '0' ? '1' : '0';
    // The signature of one path does not carry over to another.
    std::string otherMac = MediaPathToken(h.Path("/private/secret.mp3"));
    otherMac = std::string(kBase) + "ipod/" + hex + otherMac.substr(otherMac.find('-')) + ".mp3";
    h.ClearLog();
    const std::string refused[] = {
        kBase + altered + ".mp3", kBase + std::string(32, '0') + ".mp3",
        std::string(kBase) + "nothex-nothex.mp3", kBase + token, kBase + token + "x.mp3",
        kBase + MediaIDEncryption(songs[2].id + 1000) + ".mp3", "http://127.0.0.1:18080/elsewhere",
        std::string(kBase) + "ipod/" + hex + ".mp3", badMac, otherMac,
        std::string(kBase) + "ipod/" + hex.substr(1) + "-" + std::string(32, '0') + ".mp3",
        UsbUrl(usb + "/disk1/sub"), UsbUrl(usb + "/disk1/missing.mp3"),
        std::string(kBase) + "ipod/../../../etc/passwd", std::string(kBase) + "ipod/..%2f..%2fetc%2fpasswd.mp3"};
    for (const std::string &url : refused) {
        Reply r = Fetch(url);
        EXPECT_EQ(404, r.status) << url;
        EXPECT_EQ(std::string::npos, r.body.find("not for renderers")) << url;
    }
    EXPECT_GE(h.CountLog("Bad song token"), 3) << h.Log();
    EXPECT_EQ(1, h.CountLog("not in the library")) << h.Log();
    EXPECT_EQ(3, h.CountLog("No such resource")) << h.Log();
    EXPECT_GE(h.CountLog("Bad path token"), 4) << h.Log();
    EXPECT_EQ(200, Fetch(kBase + token + ".mp3").status);
    // A signed path is served wherever the file lies (songs queued by path).
    Reply r = Fetch(signedUrl);
    EXPECT_EQ(200, r.status);
    EXPECT_EQ(small, r.body);
    ASSERT_EQ(0, h.WriteFile("/elsewhere/by-path.mp3", "abc"));
    EXPECT_EQ("abc", Fetch(UsbUrl(h.Path("/elsewhere/by-path.mp3"))).body);
}

TEST_F(TarnwebTest, OverlappingRangesAreSentOnce)
{
    const std::string url = UsbUrl(usb + "/disk1/sub/song.mp3");
    Reply same = Fetch(url, "0-299999,0-299999,0-299999,0-299999,0-299999,0-299999,0-299999,0-299999");
    EXPECT_EQ(200, same.status);
    EXPECT_EQ(small, same.body);
    Reply joined = Fetch(url, "0-99,50-149,150-199");
    EXPECT_EQ(206, joined.status);
    EXPECT_EQ("bytes 0-199/300000", joined.Header("content-range"));
    EXPECT_EQ(small.substr(0, 200), joined.body);
    Reply two = Fetch(url, "10-19,100-109,15-17");  // two pieces after merging
    EXPECT_EQ(206, two.status);
    EXPECT_NE(std::string::npos, two.Header("content-type").find("multipart/byteranges"));
    EXPECT_NE(std::string::npos, two.body.find(small.substr(10, 10)));
    EXPECT_NE(std::string::npos, two.body.find(small.substr(100, 10)));
    EXPECT_LT(two.body.size(), 1000u);
}

// A connection from `from` (a loopback address) to the server; -1 on failure.
int ConnectFrom(const char *from, int receiveBuffer = 0)
{
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return -1;
    if (receiveBuffer > 0)
        setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &receiveBuffer, sizeof(receiveBuffer));
    struct sockaddr_in a = {};
    a.sin_family = AF_INET;
    inet_pton(AF_INET, from, &a.sin_addr);
    struct sockaddr_in to = {};
    to.sin_family = AF_INET;
    to.sin_port = htons(18080);
    inet_pton(AF_INET, "127.0.0.1", &to.sin_addr);
    if (bind(fd, reinterpret_cast<sockaddr *>(&a), sizeof(a)) != 0 ||
        connect(fd, reinterpret_cast<sockaddr *>(&to), sizeof(to)) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

// True while the server has not closed fd (nothing to read, no end of file).
bool StillOpen(int fd)
{
    char c;
    ssize_t n = recv(fd, &c, 1, MSG_DONTWAIT | MSG_PEEK);
    return n < 0 && errno == EAGAIN;
}

// Silent connections from many addresses and clients that ask for a big
// song and never read do not keep a renderer from its song: silent ones
// wait without a worker, and one address holds at most its share.
TEST_F(TarnwebTest, SilentAndSlowClientsDoNotStarveOthers)
{
    EXPECT_EQ(0, tarnwebtest::EndChild(h, server));
    server = tarnwebtest::StartSongServer(h, {"--bind", "127.0.0.1", "--threads", "6",
                                              "--max-per-client", "4"});
    ASSERT_GT(server, 0);
    ASSERT_EQ(0, h.WriteFile("/media/usb/disk1/big.mp3", ""));
    ASSERT_EQ(0, truncate(h.Path("/media/usb/disk1/big.mp3").c_str(), 64 << 20));
    std::vector<int> silent, slow;
    for (int i = 0; i < 200; ++i) {
        std::string from = "127.0.1." + std::to_string(i + 1);
        int fd = ConnectFrom(from.c_str());
        ASSERT_GE(fd, 0) << from;
        silent.push_back(fd);
    }
    std::string big = UsbUrl(usb + "/disk1/big.mp3");
    std::string request = "GET " + big.substr(big.find("/audio")) + " HTTP/1.1\r\nHost: x\r\n\r\n";
    for (int i = 0; i < 8; ++i) {
        int fd = ConnectFrom("127.0.2.1", 4096);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(static_cast<ssize_t>(request.size()), send(fd, request.data(), request.size(), MSG_NOSIGNAL));
        slow.push_back(fd);
    }
    usleep(300 * 1000);  // the slow ones' workers fill their buffers and block
    // A renderer still gets its songs, several times over.
    for (int i = 0; i < 3; ++i) {
        Reply r = Fetch(kBase + MediaIDEncryption(songs[i].id) + ".mp3");
        EXPECT_EQ(200, r.status) << i;
        EXPECT_TRUE(tarnwebtest::ReadAll(songs[i].path) == r.body) << i;
    }
    int open = 0;
    for (int fd : silent)
        open += StillOpen(fd) ? 1 : 0;
    EXPECT_EQ(200, open) << "silent connections are kept until their deadline";
    EXPECT_EQ(1, h.CountLog("Too many connections from 127.0.2.1")) << h.Log();
    // The address over its share can fetch again once its connections end.
    for (int fd : slow)
        close(fd);
    usleep(300 * 1000);
    g_from = "127.0.2.1";
    Reply again = Fetch(UsbUrl(usb + "/disk1/sub/song.mp3"), "0-9");
    g_from = "127.0.0.1";
    EXPECT_EQ(206, again.status);
    for (int fd : silent)
        close(fd);
}

}  // namespace
