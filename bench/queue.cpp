// Queue figures of the real tarnaudiod, through its control socket:
//   - adding 10,000 songs, one ACT_QUEUE_ADD request each: total time and
//     the median time of one request;
//   - ACT_QUEUE_LIST pages of 10 at the start and at the end of the queue;
//   - the daemon's resident memory before and after the songs were added.
// Each figure is the median over RUNS runs (a fresh daemon each run).
//
//   scripts/netns-run build/bin/bench_queue [RUNS] [SONGS]   (default 3, 10000)
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>
#include <vector>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

using Clock = std::chrono::steady_clock;

double Ms(Clock::time_point a, Clock::time_point b)
{
    return std::chrono::duration<double, std::milli>(b - a).count();
}

double Median(std::vector<double> v)
{
    if (v.empty())
        return 0;
    std::sort(v.begin(), v.end());
    size_t n = v.size();
    return n % 2 ? v[n / 2] : (v[n / 2 - 1] + v[n / 2]) / 2;
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

}  // namespace

int main(int argc, char **argv)
{
    int runs = argc > 1 ? atoi(argv[1]) : 3;
    int songs = argc > 2 ? atoi(argv[2]) : 10000;
    if (runs < 1 || songs < 20) {
        fprintf(stderr, "usage: bench_queue [RUNS>=1] [SONGS>=20]\n");
        return 2;
    }
    if (!tarntest::InPrivateNetns()) {
        fprintf(stderr, "bench_queue: run it under scripts/netns-run (the daemon sends SSDP searches)\n");
        return 2;
    }
    std::vector<double> addTotal, addOne, listStart, listEnd, rssBefore, rssAfter;
    for (int run = 0; run < runs; ++run) {
        tarntest::Harness h;
        if (h.Start() != 0) {
            fprintf(stderr, "bench_queue: %s\n", h.Error().c_str());
            return 1;
        }
        rssBefore.push_back(static_cast<double>(RssKb(h.Pid())));
        std::vector<double> one;
        one.reserve(static_cast<size_t>(songs));
        auto t0 = Clock::now();
        for (int i = 0; i < songs; ++i) {
            TARN_MEDIA_INFO info = tarntest::MakeMediaInfo(
                "/music/artist" + std::to_string(i % 97) + "/album" + std::to_string(i % 13) +
                    "/song" + std::to_string(i) + ".mp3",
                "", "Artist " + std::to_string(i % 97), 180.0f + static_cast<float>(i % 120));
            auto a = Clock::now();
            if (h.QueueAdd(info) != 0) {
                fprintf(stderr, "bench_queue: add %d failed: %s\n", i, h.Error().c_str());
                return 1;
            }
            one.push_back(Ms(a, Clock::now()));
            if ((i + 1) % 2000 == 0)
                fprintf(stderr, "run %d/%d: %d songs added\n", run + 1, runs, i + 1);
        }
        addTotal.push_back(Ms(t0, Clock::now()));
        addOne.push_back(Median(one));
        rssAfter.push_back(static_cast<double>(RssKb(h.Pid())));

        std::string reply;
        std::string endPage = std::to_string(songs - 10) + " 10";
        std::vector<double> s, e;
        for (int k = 0; k < 50; ++k) {
            auto a = Clock::now();
            if (h.Request(ACT_QUEUE_LIST, "0 10", &reply) != 0)
                return 1;
            auto b = Clock::now();
            if (h.Request(ACT_QUEUE_LIST, endPage.c_str(), &reply) != 0)
                return 1;
            auto c = Clock::now();
            s.push_back(Ms(a, b));
            e.push_back(Ms(b, c));
        }
        // The last page must really hold the last song.
        if (reply.find("song" + std::to_string(songs - 1) + "\"") == std::string::npos) {
            fprintf(stderr, "bench_queue: last page does not hold the last song:\n%s\n", reply.c_str());
            return 1;
        }
        listStart.push_back(Median(s));
        listEnd.push_back(Median(e));
        if (h.Stop() != 0) {
            fprintf(stderr, "bench_queue: daemon did not stop cleanly\n");
            return 1;
        }
    }
    printf("bench_queue: %d songs, %d runs (medians)\n", songs, runs);
    printf("  add all songs, one request each:   %10.1f ms\n", Median(addTotal));
    printf("  one ACT_QUEUE_ADD request:          %10.3f ms\n", Median(addOne));
    printf("  ACT_QUEUE_LIST 10 at the start:     %10.3f ms\n", Median(listStart));
    printf("  ACT_QUEUE_LIST 10 at the end:       %10.3f ms\n", Median(listEnd));
    printf("  daemon RSS empty queue:             %10.0f KiB\n", Median(rssBefore));
    printf("  daemon RSS with %d songs:        %10.0f KiB\n", songs, Median(rssAfter));
    return 0;
}
