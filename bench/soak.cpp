// Soak: 32 concurrent control clients against the real tarnaudiod in a
// private root, valid requests of every kind mixed with hostile clients.
//
//   bench_soak            about 3 minutes
//   bench_soak --quick    about 40 seconds
//   bench_soak --clients N --seconds S
//
// Runs only in a private network namespace (scripts/netns-run): the daemon
// sends SSDP searches at start.
//
// Phases:
//   warm-up  a short mixed phase, then a counted phase that lasts until
//            every client has made its adds (the queue's peak size and the
//            heap's shape are those of the measured run); then everything
//            is stopped and cleared and the daemon's descriptors and RSS
//            are taken as the baseline.
//   mixed    every action code, source changes, removes and clears
//            included, plus hostile clients.
//   counted  the queue is cleared once; then only requests that leave the
//            queue's membership alone, plus adds and inserts (each with a
//            song id of its own), plus hostile clients. Adds and inserts
//            are counted when their reply came.
// Then: the queue must hold exactly the counted songs (read back page by
// page), and after stop and clear the descriptor count must equal the
// baseline and RSS must not have grown by more than the tolerance.
//
// Hostile clients: connect and stay silent, send half a request and stay,
// send a whole request and close without reading the reply, connect and
// close at once, send a whole request with an undefined action code.
//
// Figures: requests answered per kind, connect retries (backlog full),
// failures (a valid client that connected but got no reply), latency
// median and 99th percentile, descriptors and RSS before and after.
// Exit status 0 when every check held, 1 otherwise.
#include <errno.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <map>
#include <mutex>
#include <random>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <json/json.h>

#include "platform/fd_read.h"
#include "daemon/ctrl.h"
#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

using Clock = std::chrono::steady_clock;

long NowMs()
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now().time_since_epoch())
        .count();
}

std::string g_socketPath;
std::vector<std::string> g_songs;

// ---- one connection ---------------------------------------------------------

enum ConnResult { CONN_OK, CONN_REFUSED, CONN_ERROR };

// Non-blocking connect so that a full backlog shows as EAGAIN (counted and
// retried by the caller) instead of a blocked thread.
ConnResult ConnectOnce(int *out)
{
    int err = 0;
    int fd = CtrlConnectAt(g_socketPath.c_str(), true, &err);
    if (fd == -2)
        return (err == EAGAIN || err == ECONNREFUSED) ? CONN_REFUSED : CONN_ERROR;
    if (fd < 0)
        return CONN_ERROR;
    *out = fd;
    return CONN_OK;
}

// ---- statistics ---------------------------------------------------------------

struct Stats {
    std::mutex m;
    std::map<int, long> answered;  // by action code
    long valid = 0;
    long refusedConnects = 0;
    long connectErrors = 0;
    long noReply = 0;  // connected, sent, no reply: a failure
    long hostile[5] = {0, 0, 0, 0, 0};
    std::vector<long> latencyMs;
    std::vector<std::string> failures;  // first few, printed
    std::set<uint32_t> addedIds;        // counted phase: answered adds/inserts
    long addsAnswered = 0;
};
Stats g_stats;

void Failure(const std::string &what)
{
    std::lock_guard<std::mutex> lock(g_stats.m);
    g_stats.noReply++;
    if (g_stats.failures.size() < 20)
        g_stats.failures.push_back(what);
}

// One valid request: connects (retrying while the backlog is full until
// deadline), writes the whole request at once, waits for the whole reply.
// 0 with the reply text, -1 when no connection could be made before the
// deadline (not a failure: the request never reached the daemon), -2 when
// the daemon took the connection but no reply came (a failure).
int ValidRequest(const ControlRequest &req, std::string *reply, long deadlineMs)
{
    int fd = -1;
    for (;;) {
        ConnResult c = ConnectOnce(&fd);
        if (c == CONN_OK)
            break;
        {
            std::lock_guard<std::mutex> lock(g_stats.m);
            if (c == CONN_REFUSED)
                g_stats.refusedConnects++;
            else
                g_stats.connectErrors++;
        }
        if (NowMs() > deadlineMs)
            return -1;
        usleep(20 * 1000);
    }
    long t0 = NowMs();
    if (write(fd, &req, sizeof(req)) != static_cast<ssize_t>(sizeof(req))) {
        close(fd);
        char what[128];
        snprintf(what, sizeof(what), "action %d: write failed: %s", req.action, strerror(errno));
        Failure(what);
        return -2;
    }
    // Generous: hostile clients hold the daemon up to 0.5 s each, and a
    // client may wait behind several of them.
    std::string data;
    TarnReadUntilClosed(fd, 60000, &data);
    close(fd);
    long ms = NowMs() - t0;
    if (data.size() != CTRL_REPLY_SIZE || data.find('\0') == std::string::npos) {
        char what[160];
        snprintf(what, sizeof(what), "action %d: reply of %zu bytes after %ld ms", req.action,
                 data.size(), ms);
        Failure(what);
        return -2;
    }
    *reply = data.substr(0, data.find('\0'));
    std::lock_guard<std::mutex> lock(g_stats.m);
    g_stats.valid++;
    g_stats.answered[req.action]++;
    g_stats.latencyMs.push_back(ms);
    return 0;
}

void Hostile(int kind, std::mt19937 &rng)
{
    int fd = -1;
    if (ConnectOnce(&fd) != CONN_OK)
        return;  // a hostile client does not insist
    ControlRequest req = tarntest::MakeRequest(ACT_GET_STATUS);
    switch (kind) {
    case 0:  // connect and stay silent past the daemon's wait
        usleep(700 * 1000);
        break;
    case 1:  // half a request, then silence
        if (write(fd, &req, sizeof(req) / 2) < 0) {
        }
        usleep(700 * 1000);
        break;
    case 2:  // a whole request, reply never read
        if (write(fd, &req, sizeof(req)) < 0) {
        }
        break;
    case 3:  // close at once
        break;
    default: {  // an undefined action code
        int codes[] = {0, -1, 37, 1000, INT32_MIN};
        req.action = codes[rng() % 5];
        if (write(fd, &req, sizeof(req)) < 0) {
        }
        std::string data;
        TarnReadUntilClosed(fd, 3000, &data);
        break;
    }
    }
    close(fd);
    std::lock_guard<std::mutex> lock(g_stats.m);
    g_stats.hostile[kind]++;
}

// ---- request mix --------------------------------------------------------------

enum Phase { PHASE_MIXED, PHASE_COUNTED };

// A request that never changes which songs are in the queue.
ControlRequest MembershipNeutral(std::mt19937 &rng, int queueHint)
{
    char p[128];
    switch (rng() % 21) {
    case 0: return tarntest::MakeRequest(ACT_GET_STATUS);
    case 1: snprintf(p, sizeof(p), "%d %d", static_cast<int>(rng() % 50), 10);
            return tarntest::MakeRequest(ACT_QUEUE_LIST, p);
    case 2: return tarntest::MakeRequest(ACT_LIST_SERVERS, "0 10");
    case 3: return tarntest::MakeRequest(ACT_LIST_RENDERERS, "0 10");
    case 4: return tarntest::MakeRequest(ACT_SELECT_PLAYER, "-1");
    case 5: snprintf(p, sizeof(p), "%d", static_cast<int>(rng() % 101));
            return tarntest::MakeRequest(ACT_SET_VOLUME, p);
    case 6: return tarntest::MakeRequest(rng() % 2 ? ACT_VOLUME_UP : ACT_VOLUME_DOWN);
    case 7: return tarntest::MakeRequest(ACT_MUTE);
    case 8: snprintf(p, sizeof(p), "%d", 1 + static_cast<int>(rng() % 3));
            return tarntest::MakeRequest(ACT_SET_REPEAT_MODE, p);
    case 9: return tarntest::MakeRequest(ACT_TOGGLE_SHUFFLE);
    case 10: return tarntest::MakeRequest(ACT_CYCLE_REPEAT_MODE);
    case 11: return tarntest::MakeRequest(rng() % 2 ? ACT_SET_CHANGED : ACT_CLEAR_CHANGED);
    case 12: return tarntest::MakeRequest(rng() % 2 ? ACT_SEARCH_SERVERS : ACT_SEARCH_RENDERERS);
    case 13: return tarntest::MakeRequest(ACT_SET_EQUALIZER,
                                          "0.0 1.5 -3.0 0.0 0.0 2.0 0.0 0.0 -1.0 4.0");
    case 14: snprintf(p, sizeof(p), "%d", static_cast<int>(rng() % (queueHint + 1)));
             return tarntest::MakeRequest(ACT_PLAY_INDEX, p);
    case 15: return tarntest::MakeRequest(ACT_STOP);
    case 16: return tarntest::MakeRequest(ACT_PLAY_PAUSE);
    case 17: return tarntest::MakeRequest(rng() % 2 ? ACT_NEXT : ACT_PREVIOUS);
    case 18: snprintf(p, sizeof(p), "%d", static_cast<int>(rng() % 5));
             return tarntest::MakeRequest(ACT_SEEK, p);
    case 19: snprintf(p, sizeof(p), "%d", static_cast<int>(rng() % (queueHint + 1)));
             return tarntest::MakeRequest(ACT_QUEUE_SET_CURRENT, p);
    default: snprintf(p, sizeof(p), "%d", 1 + static_cast<int>(rng() % 4));
             return tarntest::MakeRequest(ACT_SAVE_CUSTOM, p);
    }
}

ControlRequest SongRequest(int action, uint32_t id, int position)
{
    ControlRequest req = tarntest::MakeRequest(action);
    char title[64];
    snprintf(title, sizeof(title), "soak-%u", id);
    TARN_MEDIA_INFO info = tarntest::MakeMediaInfo(g_songs[id % g_songs.size()], title, "Soak", 1.0f);
    info.id = id;
    memcpy(req.parameter, &info, sizeof(info));
    if (action == ACT_QUEUE_INSERT) {
        int32_t pos = position;
        memcpy(reinterpret_cast<char *>(&req) + CTRL_INSERT_POS_OFFSET, &pos, sizeof(pos));
    }
    return req;
}

struct ClientConfig {
    Phase phase;
    long endMs;
    int maxAdds;        // counted phase: adds and inserts per client
    double hostileShare;
    bool untilAddsDone; // counted phase: a client ends once its adds are done
};

void Client(int index, ClientConfig cfg)
{
    std::mt19937 rng(0x50a4 + index * 7919 + static_cast<int>(cfg.phase) * 104729);
    int adds = 0;
    bool ownAddAnswered = false;
    uint32_t nextId = static_cast<uint32_t>(index + 1) * 100000u;
    while (NowMs() < cfg.endMs && !(cfg.untilAddsDone && adds >= cfg.maxAdds)) {
        if (std::uniform_real_distribution<double>(0, 1)(rng) < cfg.hostileShare) {
            Hostile(static_cast<int>(rng() % 5), rng);
            continue;
        }
        std::string reply;
        if (cfg.phase == PHASE_MIXED) {
            ControlRequest req;
            int pick = static_cast<int>(rng() % 10);
            if (pick < 3) {
                req = SongRequest(ACT_QUEUE_ADD, nextId++, 0);
            } else if (pick == 3) {
                // Source changes, removes, clears, inserts: the whole table.
                static const int kinds[] = {ACT_SOURCE_RANDOM, ACT_SOURCE_RADIO, ACT_SOURCE_IPOD,
                                            ACT_SOURCE_PLAYLIST, ACT_SOURCE_CUSTOM,
                                            ACT_SOURCE_NEXT, ACT_SOURCE_PREVIOUS,
                                            ACT_QUEUE_REMOVE, ACT_QUEUE_CLEAR, ACT_QUEUE_INSERT};
                int k = kinds[rng() % 10];
                if (k == ACT_QUEUE_INSERT)
                    req = SongRequest(k, nextId++, static_cast<int>(rng() % 20));
                else if (k == ACT_QUEUE_REMOVE || k == ACT_SOURCE_CUSTOM)
                    req = tarntest::MakeRequest(k, std::to_string(rng() % 10).c_str());
                else
                    req = tarntest::MakeRequest(k);
            } else {
                req = MembershipNeutral(rng, 20);
            }
            ValidRequest(req, &reply, cfg.endMs + 5000);
        } else {
            int pick = static_cast<int>(rng() % 10);
            bool song = adds < cfg.maxAdds && pick < 4;
            if (song) {
                // Inserts at the front only once this client's own add is in
                // the queue, so they cannot be refused as past the end.
                int action = (ownAddAnswered && pick == 0) ? ACT_QUEUE_INSERT : ACT_QUEUE_ADD;
                uint32_t id = nextId++;
                adds++;
                ControlRequest req = SongRequest(action, id, 0);
                if (ValidRequest(req, &reply, cfg.endMs + 5000) == 0) {
                    ownAddAnswered = true;
                    std::lock_guard<std::mutex> lock(g_stats.m);
                    g_stats.addedIds.insert(id);
                    g_stats.addsAnswered++;
                }
            } else {
                ValidRequest(MembershipNeutral(rng, 20), &reply, cfg.endMs + 5000);
            }
        }
    }
}

void RunPhase(tarntest::Harness &h, int clients, ClientConfig cfg, const char *name)
{
    printf("soak: %s phase, %d clients, %ld s\n", name, clients, (cfg.endMs - NowMs()) / 1000);
    fflush(stdout);
    std::vector<std::thread> threads;
    std::atomic<int> running(clients);
    for (int i = 0; i < clients; i++)
        threads.emplace_back([i, cfg, &running] {
            Client(i, cfg);
            running--;
        });
    // The daemon's mplayer-daemon processes are adopted by this process.
    long lastShown = NowMs();
    while (NowMs() < cfg.endMs && running > 0) {
        h.Reap();
        usleep(100 * 1000);
        if (NowMs() - lastShown >= 10000) {
            lastShown = NowMs();
            std::lock_guard<std::mutex> lock(g_stats.m);
            printf("soak:   %ld answered, %ld failures, %ld s left\n", g_stats.valid,
                   g_stats.noReply, (cfg.endMs - NowMs()) / 1000);
            fflush(stdout);
        }
    }
    for (std::thread &t : threads)
        t.join();
    h.Reap();
}

long RssKb(pid_t pid)
{
    std::ifstream in("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(in, line)) {
        if (line.compare(0, 6, "VmRSS:") == 0)
            return strtol(line.c_str() + 6, nullptr, 10);
    }
    return -1;
}

int Direct(tarntest::Harness &h, int action, const char *param, std::string *reply = nullptr)
{
    std::string r;
    for (int i = 0; i < 50; i++) {
        if (h.Request(action, param, &r, 5000) == 0) {
            if (reply)
                *reply = r;
            return 0;
        }
        usleep(100 * 1000);
    }
    return -1;
}

// Stops playback, empties the queue and lets the player go.
void Settle(tarntest::Harness &h)
{
    Direct(h, ACT_SELECT_PLAYER, "-1");
    Direct(h, ACT_STOP, nullptr);
    Direct(h, ACT_QUEUE_CLEAR, nullptr);
    for (int i = 0; i < 30; i++) {
        h.Reap();
        usleep(100 * 1000);
    }
}

// Every song id in the queue, read page by page.
int ReadQueue(tarntest::Harness &h, std::vector<uint32_t> *ids, int *total)
{
    ids->clear();
    *total = -1;
    for (int start = 0;; start += 10) {
        std::string reply;
        char p[32];
        snprintf(p, sizeof(p), "%d 10", start);
        if (Direct(h, ACT_QUEUE_LIST, p, &reply) != 0)
            return -1;
        Json::Value v;
        Json::Reader reader;
        if (!reader.parse(reply, v) || !v.isObject() || !v["uris"].isArray()) {
            fprintf(stderr, "soak: queue page at %d does not parse\n", start);
            return -1;
        }
        *total = v["total"].asInt();
        for (const Json::Value &item : v["uris"]) {
            std::string id = item["item_id"].asString();
            ids->push_back(static_cast<uint32_t>(strtoul(id.c_str() + id.find('@') + 1, nullptr, 10)));
        }
        if (v["uris"].size() == 0 || start + 10 >= *total)
            break;
    }
    return 0;
}

std::string Wav(int hz)
{
    const int rate = 8000, secs = 1, n = rate * secs;
    std::string d;
    auto u32 = [&](uint32_t v) { d.append(reinterpret_cast<const char *>(&v), 4); };
    auto u16 = [&](uint16_t v) { d.append(reinterpret_cast<const char *>(&v), 2); };
    d += "RIFF";
    u32(36 + n * 2);
    d += "WAVEfmt ";
    u32(16);
    u16(1);
    u16(1);
    u32(rate);
    u32(rate * 2);
    u16(2);
    u16(16);
    d += "data";
    u32(n * 2);
    for (int i = 0; i < n; i++)
        u16(static_cast<uint16_t>(static_cast<int16_t>(8000 * sin(2 * M_PI * hz * i / rate))));
    return d;
}

}  // namespace

int main(int argc, char **argv)
{
    int clients = 32;
    int seconds = 150;
    for (int i = 1; i < argc; i++) {
        if (!strcmp(argv[i], "--quick"))
            seconds = 20;
        else if (!strcmp(argv[i], "--clients") && i + 1 < argc)
            clients = std::max(1, std::min(256, atoi(argv[++i])));
        else if (!strcmp(argv[i], "--seconds") && i + 1 < argc)
            seconds = std::max(10, std::min(3600, atoi(argv[++i])));
        else {
            fprintf(stderr, "usage: bench_soak [--quick] [--clients N] [--seconds S]\n");
            return 2;
        }
    }
    if (!tarntest::InPrivateNetns()) {
        fprintf(stderr, "bench_soak: run it under scripts/netns-run (the daemon sends SSDP searches)\n");
        return 2;
    }
    // Split: 10% mixed warm-up (the adds of the warm-up take what they
    // take), 40% mixed, 50% counted.
    int warmSecs = std::max(3, seconds * 10 / 100);
    int mixedSecs = std::max(4, seconds * 40 / 100);
    int countedSecs = std::max(6, seconds - warmSecs - mixedSecs);
    const double hostileShare = 0.10;
    // Adds per client in each counted phase (the queue's peak size).
    const int maxAdds = seconds >= 120 ? 20 : 4;

    tarntest::Harness h;
    for (int i = 0; i < 4; i++) {
        std::string p = "/share/Music/soak" + std::to_string(i) + ".wav";
        h.WriteFile(p.c_str(), Wav(220 * (i + 1)));
        g_songs.push_back(h.Path(p.c_str()));
    }
    // Radio stations on a closed loopback port: the radio source has a list
    // without any fetch, and a station that cannot play fails at once.
    h.WriteFile("/usr/tarn/etc/audio/radio/favorite.json",
                "{\"stations\":[{\"name\":\"Closed\",\"url\":\"http://127.0.0.1:9/a.mp3\",\"desc\":\"\"},"
                "{\"name\":\"Closed 2\",\"url\":\"http://127.0.0.1:9/b.mp3\",\"desc\":\"\"}],\"total\":2}\n");
    if (h.Start() != 0) {
        fprintf(stderr, "bench_soak: daemon did not start: %s\n", h.Error().c_str());
        return 1;
    }
    g_socketPath = h.Path(TARN_CTRL_SOCKET);
    pid_t pid = h.Pid();
    printf("soak: daemon pid %d, root %s, %d clients, %d s (warm-up %d, mixed %d, counted %d)\n", pid,
           h.Root().c_str(), clients, warmSecs + mixedSecs + countedSecs, warmSecs, mixedSecs,
           countedSecs);

    // Warm-up: the same two phases as the measured run, the counted one
    // until every client has made all its adds, so that the queue reaches
    // the same size and the heap the same shape as in the measured run.
    RunPhase(h, clients, {PHASE_MIXED, NowMs() + warmSecs * 1000L, 0, hostileShare, false}, "warm-up (mixed)");
    Settle(h);
    RunPhase(h, clients, {PHASE_COUNTED, NowMs() + 300 * 1000L, maxAdds, hostileShare, true},
             "warm-up (adds)");
    Settle(h);
    {
        std::lock_guard<std::mutex> lock(g_stats.m);
        g_stats.addedIds.clear();
        g_stats.addsAnswered = 0;
    }
    int fds0 = tarntest::CountFds(pid);
    long rss0 = RssKb(pid);
    long warmValid;
    {
        std::lock_guard<std::mutex> lock(g_stats.m);
        warmValid = g_stats.valid;
    }
    printf("soak: baseline after warm-up: %d descriptors, RSS %ld kB (%ld requests answered)\n", fds0,
           rss0, warmValid);

    long t0 = NowMs();
    RunPhase(h, clients, {PHASE_MIXED, NowMs() + mixedSecs * 1000L, 0, hostileShare, false}, "mixed");
    Settle(h);
    {
        std::string r;
        int total = 0;
        std::vector<uint32_t> ids;
        if (ReadQueue(h, &ids, &total) != 0 || total != 0)
            printf("soak: queue not empty before the counted phase (%d)\n", total);
    }
    RunPhase(h, clients, {PHASE_COUNTED, NowMs() + countedSecs * 1000L, maxAdds, hostileShare, false},
             "counted");
    long elapsed = NowMs() - t0;

    bool ok = true;
    // The queue holds exactly the answered adds and inserts.
    std::vector<uint32_t> ids;
    int total = -1;
    if (ReadQueue(h, &ids, &total) != 0) {
        printf("soak: FAIL: queue could not be read back\n");
        ok = false;
    }
    std::multiset<uint32_t> inQueue(ids.begin(), ids.end());
    std::set<uint32_t> expected;
    long addsAnswered;
    {
        std::lock_guard<std::mutex> lock(g_stats.m);
        expected = g_stats.addedIds;
        addsAnswered = g_stats.addsAnswered;
    }
    long missing = 0, extra = 0, twice = 0;
    for (uint32_t id : expected) {
        if (inQueue.count(id) == 0)
            missing++;
    }
    for (uint32_t id : inQueue) {
        if (expected.count(id) == 0)
            extra++;
        else if (inQueue.count(id) > 1)
            twice++;
    }
    printf("soak: queue: %d entries (total %d), %ld adds/inserts answered; missing %ld, unexpected %ld, "
           "duplicated %ld\n",
           static_cast<int>(ids.size()), total, addsAnswered, missing, extra, twice);
    if (missing || extra || twice || total != static_cast<int>(expected.size()) ||
        static_cast<long>(ids.size()) != addsAnswered) {
        printf("soak: FAIL: the queue does not hold exactly the answered adds\n");
        ok = false;
    }

    Settle(h);
    int fds1 = tarntest::CountFds(pid);
    long rss1 = RssKb(pid);
    // RSS tolerance: allocator slack, not a leak (a leak of 100 bytes per
    // request shows well above it after the requests of a full run).
    long tolerance = std::max(2048L, rss0 / 10);
    printf("soak: descriptors %d -> %d, RSS %ld kB -> %ld kB (%+ld kB, tolerance %ld kB)\n", fds0, fds1,
           rss0, rss1, rss1 - rss0, tolerance);
    if (fds1 != fds0) {
        printf("soak: FAIL: descriptor count changed\n");
        ok = false;
    }
    if (rss0 < 0 || rss1 < 0 || rss1 - rss0 > tolerance) {
        printf("soak: FAIL: RSS grew beyond the tolerance\n");
        ok = false;
    }

    std::lock_guard<std::mutex> lock(g_stats.m);
    long measured = g_stats.valid - warmValid;
    std::vector<long> lat = g_stats.latencyMs;
    std::sort(lat.begin(), lat.end());
    long med = lat.empty() ? 0 : lat[lat.size() / 2];
    long p99 = lat.empty() ? 0 : lat[std::min(lat.size() - 1, lat.size() * 99 / 100)];
    printf("soak: %ld valid requests answered after warm-up in %.1f s (%.1f/s), %ld in all\n", measured,
           elapsed / 1000.0, measured * 1000.0 / std::max(1L, elapsed), g_stats.valid);
    printf("soak: latency median %ld ms, p99 %ld ms, max %ld ms\n", med, p99, lat.empty() ? 0 : lat.back());
    printf("soak: hostile clients: silent %ld, half request %ld, reply unread %ld, closed at once %ld, "
           "undefined code %ld\n",
           g_stats.hostile[0], g_stats.hostile[1], g_stats.hostile[2], g_stats.hostile[3], g_stats.hostile[4]);
    printf("soak: connects retried (backlog full) %ld, connect errors %ld\n", g_stats.refusedConnects,
           g_stats.connectErrors);
    printf("soak: answered by action:");
    for (auto &kv : g_stats.answered)
        printf(" %d:%ld", kv.first, kv.second);
    printf("\n");
    printf("soak: valid clients that connected but got no reply: %ld\n", g_stats.noReply);
    for (const std::string &f : g_stats.failures)
        printf("soak:   %s\n", f.c_str());
    if (g_stats.noReply != 0)
        ok = false;
    if (g_stats.answered.size() < 36) {
        printf("soak: FAIL: only %zu of the 36 action codes were answered\n", g_stats.answered.size());
        ok = false;
    }
    int st = h.Stop();
    printf("soak: daemon exit status %d\n", st);
    if (st != 0)
        ok = false;
    printf("soak: %s\n", ok ? "PASS" : "FAIL");
    return ok ? 0 : 1;
}
