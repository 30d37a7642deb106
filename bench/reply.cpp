// Time the daemon spends building and writing replies, without the socket:
// a queue page of the largest size that fits, the status of the local
// player. Prints medians in microseconds.
//   build/bin/bench_reply
#include <json/json.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <vector>

#include "daemon/tarnaudiod.h"
#include "player/playlist.h"
#include "player/playlist_actions.h"
#include "player/playlist_page.h"

namespace {

typedef std::chrono::steady_clock Clock;

double Median(std::vector<double> v)
{
    std::sort(v.begin(), v.end());
    return v.empty() ? 0 : v[v.size() / 2];
}

void FillQueue(Playlist &q, int n)
{
    TARN_MEDIA_INFO info;
    for (int i = 0; i < n; ++i) {
        memset(&info, 0, sizeof(info));
        info.id = static_cast<uint32_t>(i + 1);
        snprintf(info.path, sizeof(info.path), "/srv/music/Some Artist/Some Album/%02d Song number %d.mp3", i % 20, i);
        snprintf(info.title, sizeof(info.title), "Song number %d", i);
        snprintf(info.artist, sizeof(info.artist), "Some Artist");
        snprintf(info.album, sizeof(info.album), "Some Album");
        snprintf(info.genre, sizeof(info.genre), "Rock");
        info.duration = 215.5f;
        info.bitrate = 320000;
        info.sample = 44100;
        info.channels = 2;
        info.track = i % 20 + 1;
        info.year = 2001;
        info.size = 8600000;
        q.AddSong(&info);
    }
}

}  // namespace

int main()
{
    Playlist q;
    FillQueue(q, 5000);
    static char buffer[CTRL_REPLY_SIZE];
    // The largest page whose reply keeps all its entries.
    int page = 1;
    for (int n = 1; n <= 64; ++n) {
        Json::Value reply;
        PlaylistListJson(q, 2500, n, reply);
        FormatReply(reply, buffer);
        Json::Value back;
        Json::Reader reader;
        if (!reader.parse(buffer, back) || back["uris"].size() != static_cast<unsigned>(n))
            break;
        page = n;
    }
    const int rounds = 2000;
    std::vector<double> build, write, both, direct;
    std::string text;
    for (int r = 0; r < rounds; ++r) {
        auto t0 = Clock::now();
        Json::Value reply;
        PlaylistListJson(q, 2500, page, reply);
        auto t1 = Clock::now();
        FormatReply(reply, buffer);
        auto t2 = Clock::now();
        PlaylistPageText(q, 2500, page, CTRL_REPLY_SIZE - 1, &text);
        auto t3 = Clock::now();
        build.push_back(std::chrono::duration<double, std::micro>(t1 - t0).count());
        write.push_back(std::chrono::duration<double, std::micro>(t2 - t1).count());
        both.push_back(std::chrono::duration<double, std::micro>(t2 - t0).count());
        direct.push_back(std::chrono::duration<double, std::micro>(t3 - t2).count());
    }
    if (text != buffer) {
        fprintf(stderr, "reply: the page written straight differs from the page's value written\n");
        return 1;
    }
    printf("queue page of %d at 2,500 of 5,000 (%zu bytes), medians of %d:\n"
           "  as a JSON value: build %.1f us, write %.1f us, together %.1f us\n"
           "  written straight from the queue (as the daemon answers): %.1f us\n",
           page, strlen(buffer), rounds, Median(build), Median(write), Median(both), Median(direct));
    return 0;
}
