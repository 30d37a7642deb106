// Helpers of the song server and renderer tests: demo songs, a media library
// of them, the song server as a child process and a small HTTP client.
#ifndef TARN_TARNWEB_TEST_UTIL_H
#define TARN_TARNWEB_TEST_UTIL_H

#include <arpa/inet.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <curl/curl.h>

#include <cstdio>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "platform/medialib.h"
#include "tests/harness/harness.h"

namespace tarnwebtest {

struct HttpResult {
    long status = 0;
    std::map<std::string, std::string> headers;  // names in lower case
    std::string body;
    std::string error;  // curl's message when the transfer failed
};

inline size_t OnBody(char *data, size_t size, size_t n, void *user)
{
    static_cast<std::string *>(user)->append(data, size * n);
    return size * n;
}

inline size_t OnHeader(char *data, size_t size, size_t n, void *user)
{
    std::string line(data, size * n);
    size_t colon = line.find(':');
    if (colon != std::string::npos) {
        std::string name = line.substr(0, colon);
        for (char &c : name)
            c = static_cast<char>(tolower(c));
        std::string value = line.substr(colon + 1);
        while (!value.empty() && (value.front() == ' ' || value.front() == '\t'))
            value.erase(0, 1);
        while (!value.empty() && (value.back() == '\r' || value.back() == '\n'))
            value.pop_back();
        (*static_cast<std::map<std::string, std::string> *>(user))[name] = value;
    }
    return size * n;
}

// One request; range is the Range header value without "bytes=" ("" none).
inline HttpResult Fetch(const std::string &url, const std::string &range = "", bool head = false,
                        long timeoutSec = 30)
{
    HttpResult r;
    CURL *c = curl_easy_init();
    if (!c) {
        r.error = "curl_easy_init failed";
        return r;
    }
    curl_easy_setopt(c, CURLOPT_URL, url.c_str());
    curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, OnBody);
    curl_easy_setopt(c, CURLOPT_WRITEDATA, &r.body);
    curl_easy_setopt(c, CURLOPT_HEADERFUNCTION, OnHeader);
    curl_easy_setopt(c, CURLOPT_HEADERDATA, &r.headers);
    curl_easy_setopt(c, CURLOPT_TIMEOUT, timeoutSec);
    curl_easy_setopt(c, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(c, CURLOPT_PATH_AS_IS, 1L);
    curl_easy_setopt(c, CURLOPT_NOPROXY, "*");
    if (!range.empty())
        curl_easy_setopt(c, CURLOPT_RANGE, range.c_str());
    if (head)
        curl_easy_setopt(c, CURLOPT_NOBODY, 1L);
    CURLcode rc = curl_easy_perform(c);
    if (rc != CURLE_OK)
        r.error = curl_easy_strerror(rc);
    curl_easy_getinfo(c, CURLINFO_RESPONSE_CODE, &r.status);
    curl_easy_cleanup(c);
    return r;
}

inline std::string ReadAll(const std::string &path)
{
    std::ifstream in(path, std::ios::binary);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

inline std::string Hex(const std::string &bytes)
{
    std::string out;
    char d[4];
    for (unsigned char c : bytes) {
        snprintf(d, sizeof(d), "%02x", c);
        out += d;
    }
    return out;
}

// True once something accepts TCP connections on addr:port.
inline bool WaitListening(const char *addr, int port, int timeoutMs)
{
    for (int waited = 0; waited < timeoutMs; waited += 50) {
        int s = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        struct sockaddr_in a = {};
        a.sin_family = AF_INET;
        a.sin_port = htons(static_cast<uint16_t>(port));
        inet_pton(AF_INET, addr, &a.sin_addr);
        bool ok = connect(s, reinterpret_cast<struct sockaddr *>(&a), sizeof(a)) == 0;
        close(s);
        if (ok)
            return true;
        usleep(50 * 1000);
    }
    return false;
}

// Makes the three demo songs (mp3, flac, ogg) of `seconds` in dir under the
// harness root and puts them into a new media library at its default place.
// Returns the songs in library order; empty on failure (why in *error).
inline std::vector<MediaSong> MakeLibrary(tarntest::Harness &h, const char *dir, int seconds,
                                          std::string *error)
{
    std::vector<MediaSong> songs;
    std::string out;
    std::string music = h.Path(dir);
    int rc = h.Run({"/bin/sh", tarntest::SourcePath("scripts/make-demo-songs.sh"), music,
                    std::to_string(seconds)},
                   &out, 120000);
    if (rc != 0) {
        *error = "make-demo-songs.sh failed: " + out;
        return songs;
    }
    MediaLib lib;
    if (lib.Open(MediaLibDefaultPath(), true) != 0) {
        *error = "cannot create the library: " + lib.LastError();
        return songs;
    }
    ScanReport report;
    if (lib.Scan(music, &report) != 0) {
        *error = "scan failed: " + lib.LastError();
        return songs;
    }
    if (lib.ListSongs(&songs) < 0)
        *error = "listing failed: " + lib.LastError();
    return songs;
}

// The song server as a child of the test; ended by its pid.
class SongServerProcess {
public:
    SongServerProcess(tarntest::Harness &harness) : h(harness) {}
    ~SongServerProcess() { Stop(); }
    // Starts tarnweb with args and waits for it to listen on addr:port.
    bool Start(const std::vector<std::string> &args, const char *addr, int port)
    {
        std::vector<std::string> argv = {tarntest::BinPath("tarnweb")};
        argv.insert(argv.end(), args.begin(), args.end());
        pid = h.Spawn(argv, true);
        return pid > 0 && WaitListening(addr, port, 10000);
    }
    // SIGTERM; returns the exit status (-1: did not end in time).
    int Stop()
    {
        if (pid <= 0)
            return -1;
        kill(pid, SIGTERM);
        int status = h.WaitExit(pid, 10000);
        if (status == -1) {
            kill(pid, SIGKILL);
            h.WaitExit(pid, 5000);
        }
        pid = 0;
        return status;
    }
    pid_t Pid() const { return pid; }

private:
    tarntest::Harness &h;
    pid_t pid = 0;
};

}  // namespace tarnwebtest

#endif
