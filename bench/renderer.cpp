// Renderer playback figures, with the real tarnaudiod, the tarnweb song
// server and each real UPnP renderer (gmediarender, and rygel with its
// Playbin renderer; audio into a fakesink that keeps real time) in the
// private network of scripts/netns-run. What the renderer does is seen on the
// renderer itself: the bench asks it for GetPositionInfo and
// GetTransportInfo every few tens of milliseconds, apart from the daemon.
//   - play start: from sending ACT_PLAY_INDEX to the renderer PLAYING the
//     song, from a stopped renderer and while another song plays (also the
//     reply time and the renderer's first request for the song);
//   - the gap between songs: from the last moment the renderer was seen
//     playing a song to the moment it is seen PLAYING the next one, with
//     the queue playing through by itself (how long each song was seen
//     playing is printed next to it: a renderer that hangs at the end of a
//     song would show there);
//   - Repeat One: from the last moment the song was seen playing at its end
//     to the moment it is seen playing again from its start.
// The goals are printed next to the figures; each run measures them anew.
//
//   scripts/netns-run build/bin/bench_renderer [RUNS] [gmediarender|rygel] [--trace]
//   (RUNS: samples per figure, default 6; both renderers unless one is
//   named; --trace prints every change of state or track the renderer shows)
#include <curl/curl.h>
#include <json/json.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "daemon/tarn_types.h"
#include "platform/media_id.h"
#include "platform/medialib.h"
#include "tests/harness/harness.h"
#include "tests/harness/renderers.h"
#include "tests/process/tarnweb_test_util.h"
#include "tests/tools/fakedevice/fake_device.h"

namespace {

const int kSongSeconds = 4;
const int kProbeEveryMs = 25;
// The goals the figures are held against.
const double kGapMedianGoalMs = 300, kGapMaxGoalMs = 600;
const double kPlayStartGoalMs = 300;
const double kRepeatOneGoalMs = 1000;

size_t CountBytes(char *, size_t size, size_t n, void *total)
{
    *static_cast<size_t *>(total) += size * n;
    return size * n;
}

size_t KeepBytes(char *data, size_t size, size_t n, void *text)
{
    static_cast<std::string *>(text)->append(data, size * n);
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

// GET (body empty) or POST of a SOAP body to url; the status, the body in *out.
long Http(CURL *c, const std::string &url, const std::string &soapAction, const std::string &body,
          std::string *out)
{
    out->clear();
    curl_easy_reset(c);
    curl_easy_setopt(c, CURLOPT_URL, url.c_str());
    curl_easy_setopt(c, CURLOPT_WRITEFUNCTION, KeepBytes);
    curl_easy_setopt(c, CURLOPT_WRITEDATA, out);
    curl_easy_setopt(c, CURLOPT_TIMEOUT_MS, 3000L);
    curl_easy_setopt(c, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(c, CURLOPT_NOPROXY, "*");
    struct curl_slist *headers = nullptr;
    if (!soapAction.empty()) {
        headers = curl_slist_append(headers, "Content-Type: text/xml; charset=\"utf-8\"");
        headers = curl_slist_append(headers, ("SOAPACTION: \"" + soapAction + "\"").c_str());
        curl_easy_setopt(c, CURLOPT_HTTPHEADER, headers);
        curl_easy_setopt(c, CURLOPT_POSTFIELDS, body.c_str());
    }
    long status = 0;
    if (curl_easy_perform(c) == CURLE_OK)
        curl_easy_getinfo(c, CURLINFO_RESPONSE_CODE, &status);
    curl_slist_free_all(headers);
    return status;
}

// The text of the first <tag>...</tag> in xml (any namespace prefix), "" if none.
std::string Element(const std::string &xml, const std::string &tag, size_t from = 0)
{
    for (size_t p = from; (p = xml.find(tag, p)) != std::string::npos; p += tag.size()) {
        size_t open = xml.rfind('<', p);
        if (open == std::string::npos || xml.find_first_of("<>", open + 1) < p)
            continue;
        size_t gt = p + tag.size();
        if (gt >= xml.size() || xml[gt] != '>')
            continue;
        size_t end = xml.find("</", gt);
        return end == std::string::npos ? "" : xml.substr(gt + 1, end - gt - 1);
    }
    return "";
}

// "H:MM:SS[.fff]" in seconds, -1 when it is not a time.
double Seconds(const std::string &t)
{
    int h = 0, m = 0;
    double s = 0;
    return sscanf(t.c_str(), "%d:%d:%lf", &h, &m, &s) == 3 ? h * 3600 + m * 60 + s : -1;
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

double Max(const std::vector<double> &v) { return v.empty() ? -1 : *std::max_element(v.begin(), v.end()); }

void Print(const std::string &who, const char *what, const std::vector<double> &v, const char *unit,
           const std::string &goal = "")
{
    if (v.empty()) {
        printf("[%s] %-46s no samples%s\n", who.c_str(), what, goal.empty() ? "" : ("  " + goal).c_str());
    } else {
        printf("[%s] %-46s median %7.1f %s  (min %.1f, max %.1f, n=%d)%s\n", who.c_str(), what, Median(v), unit,
               *std::min_element(v.begin(), v.end()), Max(v), static_cast<int>(v.size()),
               goal.empty() ? "" : ("  " + goal).c_str());
    }
    fflush(stdout);
}

std::string Goal(const char *text, bool met) { return std::string("goal ") + text + (met ? ": met" : ": NOT met"); }

// What the renderer says of itself at one moment.
struct Sample {
    Clock::time_point t;  // when its transport state came
    std::string state;    // CurrentTransportState, "" when it did not answer
    std::string uri;      // TrackURI
    double rel = -1;      // RelTime in seconds
};

// Asks the renderer's AVTransport directly.
class Probe {
public:
    Probe() : curl(curl_easy_init()) {}
    ~Probe() { curl_easy_cleanup(curl); }
    Probe(const Probe &) = delete;
    Probe &operator=(const Probe &) = delete;

    // Finds the AVTransport control URL in the renderer's description.
    bool Open(const std::string &ip, const std::string &port, const std::string &udn)
    {
        base = "http://" + ip + ":" + port;
        std::string id = udn.compare(0, 5, "uuid:") == 0 ? udn.substr(5) : udn;
        std::string xml;
        for (const std::string &path : {std::string("/description.xml"), "/" + id + ".xml"}) {
            if (Http(curl, base + path, "", "", &xml) != 200)
                continue;
            size_t at = xml.find(":service:AVTransport:");
            if (at == std::string::npos)
                continue;
            size_t typeStart = xml.rfind('>', at) + 1;
            service = xml.substr(typeStart, xml.find('<', at) - typeStart);
            std::string control = Element(xml, "controlURL", at);
            if (control.empty())
                continue;
            control_url = control.compare(0, 4, "http") == 0 ? control : base + (control[0] == '/' ? "" : "/") + control;
            return true;
        }
        return false;
    }
    // The track first, then the state: a song handed over (Stop, then the
    // URI) shows as PLAYING only after its Play.
    Sample Ask()
    {
        Sample s;
        std::string reply;
        if (Call("GetPositionInfo", &reply)) {
            s.uri = Element(reply, "TrackURI");
            s.rel = Seconds(Element(reply, "RelTime"));
        }
        if (Call("GetTransportInfo", &reply))
            s.state = Element(reply, "CurrentTransportState");
        s.t = Clock::now();
        return s;
    }
    const std::string &ControlUrl() const { return control_url; }

private:
    bool Call(const char *action, std::string *reply)
    {
        std::string body = "<?xml version=\"1.0\"?><s:Envelope xmlns:s=\"http://schemas.xmlsoap.org/soap/envelope/\" "
                           "s:encodingStyle=\"http://schemas.xmlsoap.org/soap/encoding/\"><s:Body><u:" +
                           std::string(action) + " xmlns:u=\"" + service + "\"><InstanceID>0</InstanceID></u:" +
                           action + "></s:Body></s:Envelope>";
        return Http(curl, control_url, service + "#" + action, body, reply) == 200;
    }
    CURL *curl;
    std::string base, service, control_url;
};

struct Bench {
    std::string kind, name;
    tarntest::Harness h;
    std::vector<MediaSong> songs;
    pid_t renderer = 0, web = 0;
    Probe probe;
    Sample last;  // the last sample taken
    int samples = 0;
    double sampleMs = 0;  // the time samples took with the pause after each
    // --trace: every change of state or track is printed.
    bool trace = false;
    Sample traced;
    Clock::time_point began = Clock::now();

    ~Bench()
    {
        tarnwebtest::EndChild(h, renderer);
        tarnwebtest::EndChild(h, web);
    }
    Json::Value Ask(int action, const char *param = nullptr)
    {
        std::string text;
        Json::Value v;
        if (h.Request(action, param, &text, 5000) == 0)
            Json::Reader().parse(text, v);
        return v;
    }
    std::string Token(int i) { return MediaIDEncryption(songs[static_cast<size_t>(i)].id); }
    int Fetches(int i)
    {
        std::string log = h.ReadFile("/tmp/tarnweb-access.log");
        int n = 0;
        std::string t = Token(i);
        for (size_t p = 0; (p = log.find(t, p)) != std::string::npos; ++p)
            ++n;
        return n;
    }
    bool On(const Sample &s, int i) { return s.state == "PLAYING" && s.uri.find(Token(i)) != std::string::npos; }
    // Asks the renderer every kProbeEveryMs until pred holds for a sample
    // (left in last); false after timeoutMs. each runs on every sample.
    bool Watch(const std::function<bool(const Sample &)> &pred, int timeoutMs,
               const std::function<void(const Sample &)> &each = nullptr)
    {
        auto end = Clock::now() + std::chrono::milliseconds(timeoutMs);
        for (;;) {
            Clock::time_point asked = Clock::now();
            last = probe.Ask();
            ++samples;
            sampleMs += Ms(asked, last.t) + kProbeEveryMs;
            if (trace && (last.state != traced.state || last.uri != traced.uri)) {
                printf("  %8.3f s  %s %s at %.1f s\n", Ms(began, last.t) / 1000, last.state.c_str(), last.uri.c_str(),
                       last.rel);
                traced = last;
            }
            if (each)
                each(last);
            if (pred(last))
                return true;
            if (Clock::now() > end)
                return false;
            usleep(kProbeEveryMs * 1000);
        }
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
        snprintf(what, sizeof(what), "64 MB file, %d client%s (aggregate)%s", clients, clients > 1 ? "s" : "",
                 allGood ? "" : " [INCOMPLETE]");
        Print("tarnweb", what, rates, "MB/s");
    }
    tarnwebtest::EndChild(b.h, web);
}

// Songs, daemon, song server and renderer; the renderer found, selected and
// reachable by the probe, the songs queued.
bool Setup(Bench &b)
{
    std::string error;
    b.songs = tarnwebtest::MakeLibrary(b.h, "/music", kSongSeconds, &error);
    if (b.songs.size() != 3) {
        printf("[%s] cannot make the songs: %s\n", b.kind.c_str(), error.c_str());
        return false;
    }
    b.h.WriteFile("/etc/tarninfo.conf", "admin_port=18080\n");
    if (b.h.Start() != 0) {
        printf("[%s] tarnaudiod did not start: %s\n", b.kind.c_str(), b.h.Error().c_str());
        return false;
    }
    b.web = tarnwebtest::StartSongServer(b.h, {"--access-log", b.h.Path("/tmp/tarnweb-access.log")});
    if (b.web <= 0) {
        printf("[%s] tarnweb did not start\n", b.kind.c_str());
        return false;
    }
    // The renderer on the veth end the daemon's UPnP did not take, so that
    // its traffic crosses the pair.
    std::string daemonIp = fakedev::ListeningAddress(49152), ip, iface;
    fakedev::PeerInterface(daemonIp, ip, iface);
    b.renderer = tarntest::StartRenderer(b.h, b.kind, iface, b.name, "7d1e2c3b-4a59-4687-9a0b-c1d2e3f4a5b6");
    if (b.renderer <= 0) {
        printf("[%s] the renderer did not start\n", b.kind.c_str());
        return false;
    }
    printf("[%s] daemon's UPnP address %s, renderer on %s; waiting for it to be found (up to 120 s)\n",
           b.kind.c_str(), daemonIp.c_str(), iface.c_str());
    fflush(stdout);
    Json::Value found;
    auto end = Clock::now() + std::chrono::seconds(120);
    auto nextSearch = Clock::now() + std::chrono::seconds(10);
    while (Clock::now() < end && found.isNull()) {
        Json::Value list = b.Ask(ACT_LIST_RENDERERS, "0 0");
        for (const Json::Value &r : list["list"])
            if (r["friendly_name"].asString() == b.name)
                found = r;
        if (Clock::now() > nextSearch) {
            b.Ask(ACT_SEARCH_RENDERERS);
            nextSearch = Clock::now() + std::chrono::seconds(10);
        }
        usleep(300 * 1000);
    }
    if (found.isNull()) {
        printf("[%s] the renderer was not found; daemon log:\n%s\n", b.kind.c_str(), b.h.Log().c_str());
        return false;
    }
    std::string port = found["port"].asString();
    if (!b.probe.Open(found["ip"].asString(), port, found["udn"].asString())) {
        printf("[%s] no AVTransport in the description at %s:%s\n", b.kind.c_str(),
               found["ip"].asString().c_str(), port.c_str());
        return false;
    }
    b.Ask(ACT_SELECT_PLAYER, std::to_string(found["index"].asInt()).c_str());
    for (const MediaSong &s : b.songs) {
        TARN_MEDIA_INFO info;
        MediaSongToInfo(s, &info);
        b.h.QueueAdd(info);
    }
    printf("[%s] AVTransport at %s, asked every %d ms; songs of %d s (%.2f, %.2f, %.2f s by their tags)\n",
           b.kind.c_str(), b.probe.ControlUrl().c_str(), kProbeEveryMs, kSongSeconds, b.songs[0].duration,
           b.songs[1].duration, b.songs[2].duration);
    fflush(stdout);
    return true;
}

// ACT_PLAY_INDEX song: the reply time and the time to the renderer PLAYING
// it (and to its first request for it); false when it never played.
bool PlayOnce(Bench &b, int song, std::vector<double> &reply, std::vector<double> &fetch,
              std::vector<double> &playing)
{
    int before = b.Fetches(song);
    std::string param = std::to_string(song), text;
    auto t0 = Clock::now();
    b.h.Request(ACT_PLAY_INDEX, param.c_str(), &text, 10000);
    reply.push_back(Ms(t0, Clock::now()));
    bool fetched = false;
    bool ok = b.Watch([&](const Sample &s) { return b.On(s, song); }, 10000, [&](const Sample &s) {
        if (!fetched && b.Fetches(song) > before) {
            fetched = true;
            fetch.push_back(Ms(t0, s.t));
        }
    });
    if (ok)
        playing.push_back(Ms(t0, b.last.t));
    return ok;
}

void PlayStart(Bench &b, int runs)
{
    b.Ask(ACT_SET_REPEAT_MODE, "1");
    std::vector<double> reply, fetch, fromStopped, whilePlaying;
    for (int r = 0; r < runs; ++r) {
        b.Ask(ACT_STOP);
        if (!b.Watch([](const Sample &s) { return s.state == "STOPPED"; }, 10000))
            break;
        usleep(500 * 1000);
        // Never the song the renderer holds (the one played last), nor the
        // one that follows the playing song in the queue (which may have
        // been handed ahead).
        int song = r % 3;
        if (!PlayOnce(b, song, reply, fetch, fromStopped))
            break;
        usleep(1000 * 1000);  // let it play a moment
        if (!PlayOnce(b, (song + 2) % 3, reply, fetch, whilePlaying))
            break;
        usleep(1000 * 1000);
    }
    std::vector<double> all = fromStopped;
    all.insert(all.end(), whilePlaying.begin(), whilePlaying.end());
    Print(b.kind, "ACT_PLAY_INDEX reply", reply, "ms");
    Print(b.kind, "ACT_PLAY_INDEX -> renderer fetches the song", fetch, "ms");
    Print(b.kind, "play start, renderer stopped", fromStopped, "ms");
    Print(b.kind, "play start, another song playing", whilePlaying, "ms");
    Print(b.kind, "play start: ACT_PLAY_INDEX -> PLAYING (all)", all, "ms",
          Goal("median <= 300 ms", !all.empty() && Median(all) <= kPlayStartGoalMs));
    b.Ask(ACT_STOP);
}

// Watches until the renderer plays song from its start: PLAYING, its
// position back below where the song before it had got to (top, from the
// last sample). Some renderers name the next song as soon as it is handed,
// while the one before still plays for a while: until the position goes
// back, a sample on song or on before counts as the song before.
// *lastOn: the last sample of the song before.
bool WatchStart(Bench &b, int before, int song, Clock::time_point *lastOn, int timeoutMs)
{
    double top = b.last.rel;
    *lastOn = b.last.t;
    return b.Watch([&](const Sample &s) { return b.On(s, song) && s.rel >= 0 && s.rel <= 1.0 && s.rel < top - 0.5; },
                   timeoutMs, [&](const Sample &s) {
                       if ((b.On(s, before) || b.On(s, song)) && s.rel >= top) {
                           *lastOn = s.t;
                           top = s.rel;
                       }
                   });
}

void SongGaps(Bench &b, int runs)
{
    b.Ask(ACT_SET_REPEAT_MODE, "3");
    b.Ask(ACT_PLAY_INDEX, "0");
    std::vector<double> gaps, played;
    int current = 0;
    if (!b.Watch([&](const Sample &s) { return b.On(s, current) && s.rel >= 0 && s.rel <= 1.0; }, 10000)) {
        printf("[%s] the first song did not play\n", b.kind.c_str());
        return;
    }
    Clock::time_point started = b.last.t, lastOn;
    for (int r = 0; r < runs; ++r) {
        int next = (current + 1) % 3;
        if (!WatchStart(b, current, next, &lastOn, (kSongSeconds + 20) * 1000)) {
            printf("[%s] the next song did not play (last seen: %s %s at %.1f s)\n", b.kind.c_str(),
                   b.last.state.c_str(), b.last.uri.c_str(), b.last.rel);
            break;
        }
        gaps.push_back(Ms(lastOn, b.last.t));
        played.push_back(Ms(started, lastOn) / 1000.0);
        started = b.last.t;
        current = next;
    }
    Print(b.kind, "song seen playing (queue playing through)", played, "s");
    bool met = !gaps.empty() && Median(gaps) <= kGapMedianGoalMs && Max(gaps) <= kGapMaxGoalMs;
    Print(b.kind, "gap between songs: end -> next PLAYING", gaps, "ms",
          Goal("median <= 300 ms, max <= 600 ms", met));
    b.Ask(ACT_STOP);
}

void RepeatOne(Bench &b, int runs)
{
    b.Ask(ACT_SET_REPEAT_MODE, "2");
    b.Ask(ACT_PLAY_INDEX, "1");
    std::vector<double> again;
    const int song = 1;
    if (!b.Watch([&](const Sample &s) { return b.On(s, song); }, 10000)) {
        printf("[%s] the song did not play\n", b.kind.c_str());
        return;
    }
    for (int r = 0; r < runs; ++r) {
        // Past its middle, so that the start seen next is a new one.
        if (!b.Watch([&](const Sample &s) { return b.On(s, song) && s.rel >= kSongSeconds / 2.0; },
                     (kSongSeconds + 10) * 1000))
            break;
        Clock::time_point lastOn;
        if (!WatchStart(b, song, song, &lastOn, (kSongSeconds + 20) * 1000)) {
            printf("[%s] the song did not play again (last seen: %s %s at %.1f s)\n", b.kind.c_str(),
                   b.last.state.c_str(), b.last.uri.c_str(), b.last.rel);
            break;
        }
        again.push_back(Ms(lastOn, b.last.t));
    }
    Print(b.kind, "Repeat One: end -> playing again from start", again, "ms",
          Goal("median <= 1000 ms", !again.empty() && Median(again) <= kRepeatOneGoalMs));
    b.Ask(ACT_STOP);
}

// One renderer from start to end; false when it could not be measured.
bool Measure(const std::string &kind, int runs, bool trace)
{
    if (access(tarntest::RendererProgram(kind), X_OK) != 0) {
        printf("[%s] %s not installed: not measured\n", kind.c_str(), tarntest::RendererProgram(kind));
        return false;
    }
    Bench b;
    b.kind = kind;
    b.name = "Bench " + kind;
    b.trace = trace;
    if (!Setup(b))
        return false;
    PlayStart(b, runs);
    SongGaps(b, runs);
    RepeatOne(b, runs);
    printf("[%s] (the renderer seen every %.1f ms on average: times between two states are known to that)\n",
           kind.c_str(), b.samples ? b.sampleMs / b.samples : 0.0);
    b.h.Stop();
    return true;
}

}  // namespace

int main(int argc, char **argv)
{
    int runs = 6;
    bool trace = false;
    std::vector<std::string> kinds = {"gmediarender", "rygel"};
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        if (arg == "--trace") {
            trace = true;
        } else if (tarntest::RendererProgram(arg)) {
            kinds = {arg};
        } else if (atoi(argv[i]) > 0) {
            runs = atoi(argv[i]);
        } else {
            fprintf(stderr, "usage: bench_renderer [RUNS] [gmediarender|rygel] [--trace]\n");
            return 2;
        }
    }
    if (!tarntest::InPrivateNetns()) {
        fprintf(stderr, "bench_renderer: run it under scripts/netns-run (the daemon and the "
                        "renderer send SSDP multicast)\n");
        return 2;
    }
    curl_global_init(CURL_GLOBAL_DEFAULT);
    printf("renderer benchmark, %d samples per figure\n", runs);
    int rc = 0;
    // The renderers first: the daemon's UPnP server must get its usual
    // port, which the many short connections of the throughput runs could
    // still hold.
    for (const std::string &kind : kinds)
        if (!Measure(kind, runs, trace))
            rc = 1;
    {
        Bench b;
        Throughput(b, runs);
    }
    curl_global_cleanup();
    return rc;
}
