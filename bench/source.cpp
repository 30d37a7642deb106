// Source change benchmark: ACT_SOURCE_RANDOM on a library of 20,000 songs.
//
//   bench_source [--songs N] [--runs N]     (under scripts/netns-run)
//
// The library is filled directly (one SQLite transaction of N song rows in a
// database created by MediaLib) with N empty files standing for the songs,
// so no audio is decoded or tagged. Printed figures are medians (and min /
// max) over the runs:
//   - the library steps alone: random playlist file, loading it back;
//   - ChangeSourceRandom100 in this process with a LocalPlayer (no decoder);
//   - the request through the control socket of a running tarnaudiod, which
//     also stops and restarts the decoder process.
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <functional>
#include <memory>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include <sqlite3.h>

#include "daemon/globals.h"
#include "daemon/tarn_types.h"
#include "platform/media_playlists.h"
#include "platform/medialib.h"
#include "platform/tarn_env.h"
#include "player/localplayer.h"
#include "player/playlist.h"
#include "source/changesrc.h"
#include "tests/harness/harness.h"

namespace {

using Clock = std::chrono::steady_clock;

struct Stats {
    double median, min, max;
};

Stats Measure(int runs, const std::function<bool()> &step, bool *ok)
{
    std::vector<double> ms;
    *ok = true;
    for (int i = 0; i < runs; i++) {
        auto t0 = Clock::now();
        if (!step())
            *ok = false;
        ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - t0).count());
    }
    std::sort(ms.begin(), ms.end());
    size_t n = ms.size();
    double median = n % 2 ? ms[n / 2] : (ms[n / 2 - 1] + ms[n / 2]) / 2;
    return {median, ms.front(), ms.back()};
}

void Print(const char *what, const Stats &s, bool ok)
{
    printf("%-46s median %9.2f ms   min %9.2f   max %9.2f%s\n", what, s.median, s.min, s.max,
           ok ? "" : "   (SOME RUNS FAILED)");
    fflush(stdout);
}

// N song rows and N empty files under dir. 0 or -1.
int FillLibrary(const std::string &dir, int songs)
{
    std::string mk = "mkdir -p '" + dir + "' '" + TarnPath("/usr/tarn/var") + "'";
    if (system(mk.c_str()) != 0)
        return -1;
    {
        MediaLib lib;  // creates the schema
        if (lib.Open(MediaLibDefaultPath(), true) != 0) {
            fprintf(stderr, "bench_source: %s\n", lib.LastError().c_str());
            return -1;
        }
    }
    sqlite3 *db = nullptr;
    if (sqlite3_open(MediaLibDefaultPath().c_str(), &db) != SQLITE_OK)
        return -1;
    sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr);
    sqlite3_stmt *st = nullptr;
    sqlite3_prepare_v2(db,
                       "INSERT INTO songs(path, title, album, artist, genre, track, year, duration, bitrate,"
                       " samplerate, channels, size, mtime) VALUES(?,?,?,?,?,?,?,?,?,?,?,?,?)",
                       -1, &st, nullptr);
    int rc = 0;
    for (int i = 0; i < songs && rc == 0; i++) {
        char name[64];
        snprintf(name, sizeof(name), "/a%03d/song%05d.mp3", i / 200, i);
        std::string path = dir + name;
        std::string sub = path.substr(0, path.rfind('/'));
        mkdir(sub.c_str(), 0755);
        int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        if (fd < 0) {
            rc = -1;
            break;
        }
        close(fd);
        std::string title = "Song " + std::to_string(i);
        std::string album = "Album " + std::to_string(i / 12);
        std::string artist = "Artist " + std::to_string(i / 120);
        sqlite3_bind_text(st, 1, path.c_str(), -1, SQLITE_TRANSIENT);
        sqlite3_bind_text(st, 2, title.c_str(), -1, SQLITE_TRANSIENT);
        sqlite3_bind_text(st, 3, album.c_str(), -1, SQLITE_TRANSIENT);
        sqlite3_bind_text(st, 4, artist.c_str(), -1, SQLITE_TRANSIENT);
        sqlite3_bind_text(st, 5, "Bench", -1, SQLITE_STATIC);
        sqlite3_bind_int(st, 6, i % 12 + 1);
        sqlite3_bind_int(st, 7, 1990 + i % 30);
        sqlite3_bind_double(st, 8, 180.0 + i % 120);
        sqlite3_bind_int(st, 9, 192);
        sqlite3_bind_int(st, 10, 44100);
        sqlite3_bind_int(st, 11, 2);
        sqlite3_bind_int(st, 12, 4000000);
        sqlite3_bind_int(st, 13, 1700000000);
        if (sqlite3_step(st) != SQLITE_DONE)
            rc = -1;
        sqlite3_reset(st);
        if (i % 5000 == 4999) {
            printf("  library: %d songs\n", i + 1);
            fflush(stdout);
        }
    }
    sqlite3_finalize(st);
    sqlite3_exec(db, rc == 0 ? "COMMIT" : "ROLLBACK", nullptr, nullptr, nullptr);
    sqlite3_close(db);
    return rc;
}

}  // namespace

int main(int argc, char **argv)
{
    int songs = 20000, runs = 21;
    for (int i = 1; i + 1 < argc; i += 2) {
        if (!strcmp(argv[i], "--songs"))
            songs = atoi(argv[i + 1]);
        else if (!strcmp(argv[i], "--runs"))
            runs = atoi(argv[i + 1]);
    }
    if (songs < 1 || runs < 1 || runs > 1000) {
        fprintf(stderr, "usage: bench_source [--songs N] [--runs 1..1000]\n");
        return 2;
    }
    tarntest::Harness h;
    if (!h.Error().empty()) {
        fprintf(stderr, "bench_source: %s\n", h.Error().c_str());
        return 1;
    }
    printf("source change benchmark: %d songs, %d runs each\n", songs, runs);
    auto t0 = Clock::now();
    if (FillLibrary(h.Path("/music"), songs) != 0) {
        fprintf(stderr, "bench_source: could not fill the library under %s\n", h.Root().c_str());
        return 1;
    }
    printf("  library filled in %.1f s\n",
           std::chrono::duration<double>(Clock::now() - t0).count());

    std::string randomFile = TarnPath("/tmp/==DynaRandom100==.@remote_control");
    bool ok;
    Stats s = Measure(runs, [&] { return AudioFile::PlaylistRandomCreate(randomFile.c_str(), 100) != 0; }, &ok);
    Print("random playlist file (100 of the library)", s, ok);
    s = Measure(runs, [&] {
        std::unique_ptr<AudioFile::PlaylistFile> f(AudioFile::PlaylistFileLoad(randomFile.c_str(), 0, 0));
        return f && f->Count() == 100;
    }, &ok);
    Print("loading the random playlist file", s, ok);

    {
        // No decoder binary: the player's start attempt fails fast.
        std::string copy = h.Path("/usr/tarn/bin/mplayer-daemon");
        std::string saved = copy + ".bench";
        rename(copy.c_str(), saved.c_str());
        LocalPlayer player;
        s = Measure(runs, [&] {
            return ChangeSourceRandom100(&player, true) == 0 && player.GetPlaylist()->Count() == 100;
        }, &ok);
        Print("ChangeSourceRandom100 in process", s, ok);
        rename(saved.c_str(), copy.c_str());
    }

    if (!tarntest::InPrivateNetns()) {
        printf("daemon figures skipped: run under scripts/netns-run\n");
        return 0;
    }
    if (h.Start() != 0) {
        fprintf(stderr, "bench_source: %s\n", h.Error().c_str());
        return 1;
    }
    s = Measure(runs, [&] {
        std::string reply;
        return h.Request(ACT_SOURCE_RANDOM, nullptr, &reply, 10000) == 0;
    }, &ok);
    Print("ACT_SOURCE_RANDOM through the socket", s, ok);
    std::string reply;
    h.Request(ACT_QUEUE_LIST, "0 1", &reply);
    bool full = reply.find("\"total\" : 100") != std::string::npos;
    printf("  queue after the last request: %s\n", full ? "100 songs" : "NOT 100 songs");
    h.Stop();
    return ok && full ? 0 : 1;
}
