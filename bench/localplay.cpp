// Local playback figures, with the real tarnaudiod and mplayer-daemon
// writing to a WAV file (TARN_AUDIO_OUT=wav:PATH):
//   - start latency: from sending ACT_PLAY_INDEX to mplayer-daemon reporting
//     state 2 for that song in the player status segment, both with no
//     player running (the process is started) and with one playing (the
//     song is sent with "loadfile");
//   - the pause between two consecutive songs of the queue: the silence in
//     the output and the time the output stood still at the change;
//   - mplayer-daemon's CPU time (user + system, /proc/<pid>/stat) per minute
//     of playback.
// Each figure is the median of repeated runs.
//
//   scripts/netns-run build/bin/bench_localplay [RUNS]     (default 7)
#include <json/json.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"
#include "tests/process/localplay_wav.h"

namespace {

// Seconds of silence (|x| <= threshold) around time `at`.
double GapAround(const localplay::Wav &wav, double at, int threshold = 200)
{
    long n = long(wav.left.size()), before = long(at * wav.rate), after = before;
    if (before < 0 || before >= n)
        return -1;
    while (before > 0 && std::abs(wav.left[before]) <= threshold)
        --before;
    while (after < n - 1 && std::abs(wav.left[after]) <= threshold)
        ++after;
    return double(after - before - 1) / wav.rate;
}


using Clock = std::chrono::steady_clock;
using tarntest::Harness;
using tarntest::MakeMediaInfo;

double Median(std::vector<double> v)
{
    if (v.empty())
        return -1;
    std::sort(v.begin(), v.end());
    size_t n = v.size();
    return n % 2 ? v[n / 2] : (v[n / 2 - 1] + v[n / 2]) / 2;
}

std::string Range(const std::vector<double> &v, const char *fmt)
{
    if (v.empty())
        return "no samples";
    char b[128];
    std::string f = std::string("median ") + fmt + "  (min " + fmt + ", max " + fmt + ", n=%d)";
    snprintf(b, sizeof(b), f.c_str(), Median(v), *std::min_element(v.begin(), v.end()),
             *std::max_element(v.begin(), v.end()), static_cast<int>(v.size()));
    return b;
}

bool WaitFor(const std::function<bool()> &pred, int timeoutMs, int stepUs = 1000)
{
    auto end = Clock::now() + std::chrono::milliseconds(timeoutMs);
    while (Clock::now() < end) {
        if (pred())
            return true;
        usleep(stepUs);
    }
    return pred();
}

int Run(const std::string &cmd)
{
    int rc = system(cmd.c_str());
    if (rc != 0)
        fprintf(stderr, "bench_localplay: failed: %s\n", cmd.c_str());
    return rc;
}

// user + system CPU seconds of a process, -1 when unreadable.
double CpuSeconds(int pid)
{
    std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    size_t close = text.rfind(')');
    if (close == std::string::npos)
        return -1;
    std::istringstream rest(text.substr(close + 2));
    std::string field;
    unsigned long long utime = 0, stime = 0;
    // Fields after the name: state(3) ... utime(14) stime(15).
    for (int i = 3; i <= 15 && rest >> field; ++i) {
        if (i == 14)
            utime = strtoull(field.c_str(), nullptr, 10);
        if (i == 15)
            stime = strtoull(field.c_str(), nullptr, 10);
    }
    return double(utime + stime) / sysconf(_SC_CLK_TCK);
}

class Bench {
public:
    explicit Bench(const std::string &songs) : songs(songs) {}

    int Start()
    {
        wavPath = h.Root() + "/out.wav";
        setenv("TARN_AUDIO_OUT", ("wav:" + wavPath).c_str(), 1);
        if (h.Start() != 0) {
            fprintf(stderr, "bench_localplay: tarnaudiod did not start: %s\n", h.Error().c_str());
            return -1;
        }
        return 0;
    }

    Json::Value Status()
    {
        std::string text;
        Json::Value v;
        if (h.Request(ACT_GET_STATUS, nullptr, &text, 1000) == 0)
            Json::Reader().parse(text, v);
        return v;
    }

    int MplayerPid() { return atoi(h.ReadFile(TARN_MPLAYER_PID_FILE).c_str()); }

    // Stops playback and waits until mplayer-daemon has ended.
    bool StopPlayback()
    {
        h.Request(ACT_STOP, nullptr, nullptr, 3000);
        bool ok = WaitFor(
            [&] {
                h.Reap();
                return Status()["fdMplayer"].asInt() == -1 && !h.Exists(TARN_MPLAYER_PID_FILE);
            },
            5000, 20000);
        // The next run starts from a segment that reports nothing.
        if (PlayerStatusShm *seg = h.PlayerSegmentWritable()) {
            seg->state = 0;
            seg->position = 0;
            seg->duration = 0;
            seg->currentUri[0] = '\0';
        }
        return ok;
    }

    void SetQueue(const std::vector<std::string> &files)
    {
        h.Request(ACT_QUEUE_CLEAR);
        for (const std::string &f : files)
            h.QueueAdd(MakeMediaInfo(songs + "/" + f));
    }

    // Seconds from sending ACT_PLAY_INDEX to the segment reporting state 2
    // for the song; -1 on time-out.
    double TimeToPlaying(const char *index, const std::string &file)
    {
        const PlayerStatusShm *seg = h.PlayerSegment();
        if (!seg)
            return -1;
        std::string uri = songs + "/" + file;
        auto t0 = Clock::now();
        if (h.Request(ACT_PLAY_INDEX, index, nullptr, 3000) != 0)
            return -1;
        bool ok = WaitFor(
            [&] {
                return seg->state == PLAYER_STATE_PLAYING &&
                       strncmp(seg->currentUri, uri.c_str(), sizeof(seg->currentUri)) == 0;
            },
            10000, 200);
        if (!ok)
            return -1;
        return std::chrono::duration<double>(Clock::now() - t0).count();
    }

    void StartLatency(int runs)
    {
        std::vector<double> cold, warm;
        SetQueue({"long-440.flac", "tone-660.flac"});
        for (int i = 0; i < runs; ++i) {
            fprintf(stderr, "start latency: run %d/%d\n", i + 1, runs);
            StopPlayback();
            double c = TimeToPlaying("0", "long-440.flac");
            if (c >= 0)
                cold.push_back(c * 1000);
            // Wait for the connection so that the next song goes by loadfile.
            WaitFor([&] { return Status()["fdMplayer"].asInt() >= 0; }, 5000, 10000);
            usleep(300000);
            double w = TimeToPlaying("1", "tone-660.flac");
            if (w >= 0)
                warm.push_back(w * 1000);
        }
        StopPlayback();
        printf("start latency, no player running (process start): %s\n",
               Range(cold, "%.1f ms").c_str());
        printf("start latency, player running (loadfile):         %s\n",
               Range(warm, "%.1f ms").c_str());
    }

    // Plays a queue of two songs to its end and measures the pause between
    // them two ways: the silence the WAV output holds between the two tones,
    // and the real-time stall at the change: the output is written at the
    // pace of playback, so how far the written audio falls behind the wall
    // clock during the second song, compared with the first, is the time
    // the output stood still in between.
    void Gap(const std::string &first, const std::string &second, double f1, double f2, int runs)
    {
        std::vector<double> silences, stalls;
        SetQueue({first, second});
        for (int i = 0; i < runs; ++i) {
            fprintf(stderr, "gap %s -> %s: run %d/%d\n", first.c_str(), second.c_str(), i + 1,
                    runs);
            StopPlayback();
            h.Request(ACT_PLAY_INDEX, "0", nullptr, 3000);
            WaitFor([&] { return Status()["fdMplayer"].asInt() >= 0; }, 5000, 10000);
            // (wall-clock seconds, audio seconds written) while it plays.
            std::vector<std::pair<double, double>> samples;
            auto t0 = Clock::now();
            auto nextStatus = t0;
            for (;;) {
                auto now = Clock::now();
                struct stat st;
                if (stat(wavPath.c_str(), &st) == 0 && st.st_size > 44)
                    samples.emplace_back(std::chrono::duration<double>(now - t0).count(),
                                         double(st.st_size - 44) / (44100.0 * 4));
                if (now >= nextStatus) {
                    // Normal mode: the player stops by itself after the second song.
                    if (Status()["fdMplayer"].asInt() == -1 || now - t0 > std::chrono::seconds(20))
                        break;
                    nextStatus = now + std::chrono::milliseconds(100);
                }
                usleep(500);
            }
            WaitFor([&] { h.Reap(); return !h.Exists(TARN_MPLAYER_PID_FILE); }, 5000, 20000);
            localplay::Wav wav;
            if (!localplay::LoadWav(wavPath, &wav))
                continue;
            std::vector<localplay::Run> found = localplay::ToneRuns(wav, {f1, f2});
            if (found.size() != 2 || found[0].tone != 0 || found[1].tone != 1) {
                fprintf(stderr, "gap: unexpected output (%d tone runs), run skipped\n",
                        static_cast<int>(found.size()));
                continue;
            }
            double end1 = found[0].start + found[0].length;
            silences.push_back(GapAround(wav, (end1 + found[1].start) / 2) * 1000);

            // The output grows in blocks of the decoder's size d, each
            // written when its playback starts. Right after a block arrives
            // the lag (wall clock minus audio written) is C - d, where C is
            // the song's constant offset between playback and the clock; the
            // smallest lag of a song plus its block length gives C.
            auto offset = [&](double from, double to) {
                double best = 1e9;
                std::vector<double> steps;
                for (size_t k = 0; k < samples.size(); ++k) {
                    const auto &s = samples[k];
                    if (s.second < from || s.second > to)
                        continue;
                    best = std::min(best, s.first - s.second);
                    if (k > 0 && s.second > samples[k - 1].second)
                        steps.push_back(s.second - samples[k - 1].second);
                }
                return best + Median(steps);
            };
            double lag1 = offset(0.3, end1 - 0.2);
            double lag2 = offset(found[1].start + 0.3, found[1].start + found[1].length - 0.2);
            if (lag1 < 1e8 && lag2 < 1e8)
                stalls.push_back((lag2 - lag1) * 1000);
        }
        printf("silence in the output between songs, %s -> %s: %s\n", first.c_str(),
               second.c_str(), Range(silences, "%.1f ms").c_str());
        printf("output stall at the song change,     %s -> %s: %s\n", first.c_str(),
               second.c_str(), Range(stalls, "%.1f ms").c_str());
    }

    void Cpu(const std::string &file, int runs, int seconds)
    {
        std::vector<double> perMinute;
        SetQueue({file});
        for (int i = 0; i < runs; ++i) {
            fprintf(stderr, "cpu %s: run %d/%d (%d s)\n", file.c_str(), i + 1, runs, seconds);
            StopPlayback();
            h.Request(ACT_PLAY_INDEX, "0", nullptr, 3000);
            if (!WaitFor([&] { return Status()["fdMplayer"].asInt() >= 0 && MplayerPid() > 0; },
                         5000, 10000) ||
                !WaitFor([&] { return Status()["Position"].asInt() >= 1; }, 10000, 20000)) {
                fprintf(stderr, "cpu: playback did not start: %s\n",
                        Status().toStyledString().c_str());
                continue;
            }
            int pid = MplayerPid();
            double c0 = CpuSeconds(pid);
            auto t0 = Clock::now();
            sleep(static_cast<unsigned>(seconds));
            double c1 = CpuSeconds(pid);
            double wall = std::chrono::duration<double>(Clock::now() - t0).count();
            if (c0 < 0 || c1 < 0 || pid != MplayerPid()) {
                fprintf(stderr, "cpu: mplayer-daemon %d was not readable or changed\n", pid);
                continue;
            }
            perMinute.push_back((c1 - c0) / wall * 60.0);
        }
        StopPlayback();
        printf("mplayer-daemon CPU per minute of playback, %s: %s\n", file.c_str(),
               Range(perMinute, "%.2f s").c_str());
    }

private:
    Harness h;
    std::string songs;
    std::string wavPath;
};

}  // namespace

int main(int argc, char **argv)
{
    int runs = argc > 1 ? atoi(argv[1]) : 7;
    if (runs < 1 || runs > 100) {
        fprintf(stderr, "usage: %s [RUNS 1..100]\n", argv[0]);
        return 2;
    }
    if (!tarntest::InPrivateNetns()) {
        fprintf(stderr, "bench_localplay: run it under scripts/netns-run (the daemon sends "
                        "SSDP searches)\n");
        return 2;
    }
    if (access(tarntest::BinPath("mplayer-daemon").c_str(), X_OK) != 0) {
        fprintf(stderr, "bench_localplay: %s is missing; build the mplayer-daemon target\n",
                tarntest::BinPath("mplayer-daemon").c_str());
        return 1;
    }
    signal(SIGPIPE, SIG_IGN);

    char tmpl[] = "/tmp/bench-localplay.XXXXXX";
    if (!mkdtemp(tmpl)) {
        perror("mkdtemp");
        return 1;
    }
    std::string songs = tmpl;
    fprintf(stderr, "making songs in %s\n", songs.c_str());
    if (Run("sh '" + tarntest::SourcePath("scripts/make-demo-songs.sh") + "' '" + songs +
            "' 2 >/dev/null") != 0 ||
        Run("sox -q -n -r 44100 -c 2 -b 16 '" + songs +
            "/long-440.flac' synth 40 sine 440 gain -6") != 0)
        return 1;

    int rc = 0;
    {
        Bench bench(songs);
        if (bench.Start() != 0) {
            rc = 1;
        } else {
            printf("local playback, %d runs each, output to a WAV file\n", runs);
            bench.StartLatency(runs);
            bench.Gap("tone-660.flac", "tone-880.ogg", 660, 880, runs);
            bench.Gap("tone-440.mp3", "tone-660.flac", 440, 660, runs);
            bench.Cpu("long-440.flac", std::min(runs, 3), 10);
        }
    }
    Run("rm -rf '" + songs + "'");
    return rc;
}
