// Renderer playback figures, with the real tarnaudiod, the tarnweb song
// server and a UPnP renderer (gmediarender, audio into a fakesink) in the
// private network of scripts/netns-run:
//   - song server throughput: one large file downloaded whole by 1, 4 and 8
//     clients at once on loopback (aggregate MB/s);
//   - play latency: from sending ACT_PLAY_INDEX to (a) its reply, (b) the
//     renderer's first request for the song at the song server, (c) the
//     status reply showing the renderer on the new song in state PLAYING;
//   - the gap between songs: from the status leaving PLAYING at the end of
//     a song to PLAYING on the next one (the end-of-song check runs every
//     6 s and the renderer is asked for its state once a second, so the
//     gap is mostly those two periods).
// Each figure is the median of repeated runs.
//
//   scripts/netns-run build/bin/bench_renderer [RUNS]     (default 5)
#include <curl/curl.h>
#include <json/json.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "daemon/tarn_types.h"
#include "platform/media_id.h"
#include "platform/medialib.h"
#include "tests/harness/harness.h"
#include "tests/process/tarnweb_test_util.h"
#include "tests/tools/fakedevice/fake_device.h"

namespace {

size_t CountBytes(char *, size_t size, size_t n, void *total)
{
    *static_cast<size_t *>(total) += size * n;
    return size * n;
}

// GET of url; the number of body bytes, the status in *status.
size_t FetchSize(const std::string &url, long *status)
{
    size_t total = 0;
    *status = 0;
    CURL *c = curl_easy_init();
    if (!c)
        return 0;
    curl_easy_setopt(c, CURLOPT_URL, url.c_str());
    curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, CountBytes);
    curl_easy_setopt(c, CURLOPT_WRITEDATA, &total);
    curl_easy_setopt(c, CURLOPT_TIMEOUT, 120L);
    curl_easy_setopt(c, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(c, CURLOPT_NOPROXY, "*");
    curl_easy_perform(c);
    curl_easy_getinfo(c, CURLINFO_RESPONSE_CODE, status);
    curl_easy_cleanup(c);
    return total;
}

using Clock = std::chrono::steady_clock;

double Ms(Clock::time_point a, Clock::time_point b)
{
    return std::chrono::duration<double, std::milli>(b - a).count();
}

double Median(std::vector<double> v)
{
    if (v.empty())
        return -1;
    std::sort(v.begin(), v.end());
    size_t n = v.size();
    return n % 2 ? v[n / 2] : (v[n / 2 - 1] + v[n / 2]) / 2;
}

void Print(const char *what, const std::vector<double> &v, const char *unit)
{
    if (v.empty()) {
        printf("%-44s no samples\n", what);
        return;
    }
    printf("%-44s median %8.1f %s  (min %.1f, max %.1f, n=%d)\n", what, Median(v), unit,
           *std::min_element(v.begin(), v.end()), *std::max_element(v.begin(), v.end()),
           static_cast<int>(v.size()));
    fflush(stdout);
}

struct Bench {
    tarntest::Harness h;
    std::vector<MediaSong> songs;
    int renderer = 0;

    Json::Value Ask(int action, const char *param = nullptr)
    {
        std::string text;
        Json::Value v;
        if (h.Request(action, param, &text, 5000) == 0)
            Json::Reader().parse(text, v);
        return v;
    }
    std::string Token(int i) { return MediaIDEncryption(songs[i].id); }
    int Fetches(int i)
    {
        std::string log = h.ReadFile("/tmp/tarnweb-access.log");
        int n = 0;
        std::string t = Token(i);
        for (size_t p = 0; (p = log.find(t, p)) != std::string::npos; ++p)
            ++n;
        return n;
    }
    bool PlayingSong(const Json::Value &s, int i)
    {
        return s["TransportState"] == "PLAYING" &&
               s["CurrentURI"].asString().find(Token(i)) != std::string::npos;
    }
    // Polls until pred holds (every 20 ms); false after timeoutMs.
    bool Wait(const std::function<bool()> &pred, int timeoutMs)
    {
        auto end = Clock::now() + std::chrono::milliseconds(timeoutMs);
        while (Clock::now() < end) {
            if (pred())
                return true;
            usleep(20 * 1000);
        }
        return pred();
    }
};

void Throughput(Bench &b, int runs)
{
    const size_t kSize = 64u << 20;
    std::string big(kSize, '\0');
    for (size_t i = 0; i < kSize; ++i)
        big[i] = static_cast<char>(i * 2654435761u >> 13);
    b.h.WriteFile("/media/usb/big.flac", big);
    std::string url = "http://127.0.0.1:18080/audio/webUI/audiotransfer.cgi/ipod/" +
                      MediaPathToken(b.h.Path("/media/usb/big.flac")) + ".flac";
    pid_t web = tarnwebtest::StartSongServer(b.h, {"--port", "18080", "--bind", "127.0.0.1", "--threads", "8"});
    if (web <= 0) {
        printf("tarnweb did not start for the throughput runs\n");
        return;
    }
    for (int clients : {1, 4, 8}) {
        std::vector<double> rates;
        bool allGood = true;
        for (int r = 0; r < runs; ++r) {
            std::atomic<size_t> bytes(0);
            std::atomic<int> bad(0);
            auto t0 = Clock::now();
            std::vector<std::thread> threads;
            for (int c = 0; c < clients; ++c) {
                threads.emplace_back([&] {
                    long status = 0;
                    size_t got = FetchSize(url, &status);
                    if (status != 200 || got != kSize)
                        ++bad;
                    bytes += got;
                });
            }
            for (std::thread &t : threads)
                t.join();
            double sec = Ms(t0, Clock::now()) / 1000.0;
            if (bad.load() != 0)
                allGood = false;
            rates.push_back(static_cast<double>(bytes.load()) / (1 << 20) / sec);
        }
        char what[96];
        snprintf(what, sizeof(what), "tarnweb 64 MB file, %d client%s (aggregate)%s", clients,
                 clients > 1 ? "s" : "", allGood ? "" : " [INCOMPLETE]");
        Print(what, rates, "MB/s");
    }
    tarnwebtest::EndChild(b.h, web);
}

bool StartRendererSetup(Bench &b)
{
    std::string error;
    b.songs = tarnwebtest::MakeLibrary(b.h, "/music", 4, &error);
    if (b.songs.size() != 3) {
        printf("cannot make the songs: %s\n", error.c_str());
        return false;
    }
    b.h.WriteFile("/etc/tarninfo.conf", "admin_port=18080\n");
    if (b.h.Start() != 0) {
        printf("tarnaudiod did not start: %s\n", b.h.Error().c_str());
        return false;
    }
    std::string daemonIp = fakedev::ListeningAddress(49152), ip, iface;
    fakedev::PeerInterface(daemonIp, ip, iface);
    printf("daemon's UPnP address %s, renderer on %s\n", daemonIp.c_str(), iface.c_str());
    b.renderer = b.h.Spawn({"/usr/bin/gmediarender", "-I", iface, "-p", "49494", "-f", "Bench Renderer",
                            "-u", "7d1e2c3b-4a59-4687-9a0b-c1d2e3f4a5b6", "--gstout-audiopipe",
                            "fakesink sync=true", "--logfile", b.h.Path("/tmp/gmediarender.log")});
    printf("waiting for the renderer to be found (up to 120 s) ...\n");
    fflush(stdout);
    int index = -1;
    auto end = Clock::now() + std::chrono::seconds(120);
    auto nextSearch = Clock::now() + std::chrono::seconds(10);
    while (Clock::now() < end && index < 0) {
        Json::Value list = b.Ask(ACT_LIST_RENDERERS, "0 0");
        for (const Json::Value &r : list["list"])
            if (r["friendly_name"].asString() == "Bench Renderer")
                index = r["index"].asInt();
        if (Clock::now() > nextSearch) {
            b.Ask(ACT_SEARCH_RENDERERS);
            nextSearch = Clock::now() + std::chrono::seconds(10);
        }
        usleep(300 * 1000);
    }
    if (index < 0) {
        std::string log = b.h.ReadFile("/tmp/gmediarender.log");
        printf("the renderer was not found; the end of its log:\n%s\ndaemon log:\n%s\n",
               log.substr(log.size() > 1500 ? log.size() - 1500 : 0).c_str(), b.h.Log().c_str());
        return false;
    }
    b.Ask(ACT_SELECT_PLAYER, std::to_string(index).c_str());
    for (const MediaSong &s : b.songs) {
        TARN_MEDIA_INFO info;
        MediaSongToInfo(s, &info);
        b.h.QueueAdd(info);
    }
    return true;
}

void PlayLatency(Bench &b, int runs)
{
    std::vector<double> reply, fetch, playing;
    for (int r = 0; r < runs; ++r) {
        int song = r % 3;
        int before = b.Fetches(song);
        std::string param = std::to_string(song);
        auto t0 = Clock::now();
        std::string text;
        b.h.Request(ACT_PLAY_INDEX, param.c_str(), &text, 10000);
        auto t1 = Clock::now();
        reply.push_back(Ms(t0, t1));
        if (b.Wait([&] { return b.Fetches(song) > before; }, 10000))
            fetch.push_back(Ms(t0, Clock::now()));
        if (b.Wait([&] { return b.PlayingSong(b.Ask(ACT_GET_STATUS), song); }, 10000))
            playing.push_back(Ms(t0, Clock::now()));
        usleep(1500 * 1000);  // let it play a moment: the next start stops it first
    }
    Print("ACT_PLAY_INDEX reply", reply, "ms");
    Print("ACT_PLAY_INDEX -> renderer fetches the song", fetch, "ms");
    Print("ACT_PLAY_INDEX -> status PLAYING on the song", playing, "ms");
}

void SongGaps(Bench &b, int runs)
{
    b.Ask(ACT_SET_REPEAT_MODE, "3");
    b.Ask(ACT_PLAY_INDEX, "0");
    std::vector<double> gaps;
    int current = 0;
    for (int r = 0; r < runs; ++r) {
        if (!b.Wait([&] { return b.PlayingSong(b.Ask(ACT_GET_STATUS), current); }, 20000))
            break;
        Clock::time_point left;
        if (!b.Wait([&] {
                Json::Value s = b.Ask(ACT_GET_STATUS);
                left = Clock::now();
                return s["TransportState"] != "PLAYING";
            }, 20000))
            break;
        int next = (current + 1) % 3;
        if (!b.Wait([&] { return b.PlayingSong(b.Ask(ACT_GET_STATUS), next); }, 20000))
            break;
        gaps.push_back(Ms(left, Clock::now()));
        current = next;
    }
    Print("gap between songs (not PLAYING -> PLAYING)", gaps, "ms");
    printf("  (4 s songs: the 6 s end check, counted from each start, comes about 1 s after\n"
           "   the end; with songs of any length the wait for the check is 0 to 6 s)\n");
    b.Ask(ACT_STOP);
}

}  // namespace

int main(int argc, char **argv)
{
    int runs = argc > 1 ? atoi(argv[1]) : 5;
    if (runs < 1)
        runs = 1;
    if (!tarntest::InPrivateNetns()) {
        fprintf(stderr, "bench_renderer: run it under scripts/netns-run (the daemon and the "
                        "renderer send SSDP multicast)\n");
        return 2;
    }
    Bench b;
    printf("renderer benchmark, %d runs per figure\n", runs);
    int rc = 0;
    {
        // The renderer part first: the daemon's UPnP server must get its
        // usual port, which the many short connections of the throughput
        // runs could still hold.
        pid_t web = 0;
        if (!StartRendererSetup(b)) {
            rc = 1;
        } else if ((web = tarnwebtest::StartSongServer(b.h, {"--access-log", b.h.Path("/tmp/tarnweb-access.log")})) <= 0) {
            printf("tarnweb did not start\n");
            rc = 1;
        } else {
            PlayLatency(b, runs);
            SongGaps(b, runs);
        }
        if (b.renderer > 0) {
            kill(b.renderer, SIGTERM);
            b.h.WaitExit(b.renderer, 5000);
        }
        tarnwebtest::EndChild(b.h, web);
    }
    Throughput(b, runs);
    return rc;
}
