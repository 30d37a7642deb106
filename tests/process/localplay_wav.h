// Reading what mplayer-daemon wrote to its WAV output (TARN_AUDIO_OUT=wav:PATH):
// 16-bit PCM, interleaved. The demo songs are pure sine tones, so a short
// window's frequency is well estimated from its zero crossings and its
// loudness from its RMS. Used by the local playback tests and benchmark.
#ifndef TARN_TEST_LOCALPLAY_WAV_H
#define TARN_TEST_LOCALPLAY_WAV_H

#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

namespace localplay {

struct Wav {
    int rate = 0;
    int channels = 0;
    std::vector<int16_t> left;   // first channel only
    double Seconds() const { return rate > 0 ? double(left.size()) / rate : 0.0; }
};

// Loads PATH; false when it is not a 16-bit PCM WAV. A data chunk whose size
// field is not yet final (the writer still runs) is read up to the file end.
inline bool LoadWav(const std::string &path, Wav *wav)
{
    std::ifstream in(path, std::ios::binary);
    if (!in)
        return false;
    std::stringstream ss;
    ss << in.rdbuf();
    const std::string data = ss.str();
    if (data.size() < 12 || data.compare(0, 4, "RIFF") != 0 || data.compare(8, 4, "WAVE") != 0)
        return false;
    auto u32 = [&](size_t at) {
        uint32_t v;
        memcpy(&v, data.data() + at, 4);
        return v;
    };
    auto u16 = [&](size_t at) {
        uint16_t v;
        memcpy(&v, data.data() + at, 2);
        return v;
    };
    size_t at = 12;
    int bits = 0;
    while (at + 8 <= data.size()) {
        std::string id = data.substr(at, 4);
        size_t size = u32(at + 4);
        size_t body = at + 8;
        if (id == "fmt " && body + 16 <= data.size()) {
            wav->channels = u16(body + 2);
            wav->rate = static_cast<int>(u32(body + 4));
            bits = u16(body + 14);
        } else if (id == "data") {
            if (bits != 16 || wav->channels < 1)
                return false;
            size_t end = body + size;
            if (end > data.size() || size == 0)
                end = data.size();
            size_t frame = 2 * static_cast<size_t>(wav->channels);
            size_t frames = (end - body) / frame;
            wav->left.resize(frames);
            for (size_t i = 0; i < frames; ++i)
                memcpy(&wav->left[i], data.data() + body + i * frame, 2);
            return true;
        }
        at = body + size + (size & 1);
    }
    return false;
}

struct Window {
    double start;   // seconds
    double rms;     // 0..32768
    double freq;    // Hz, from zero crossings
};

inline std::vector<Window> Analyse(const Wav &wav, double windowSeconds = 0.05)
{
    std::vector<Window> out;
    size_t n = static_cast<size_t>(windowSeconds * wav.rate);
    if (n == 0)
        return out;
    for (size_t at = 0; at + n <= wav.left.size(); at += n) {
        double sum = 0;
        int crossings = 0;
        for (size_t i = at; i < at + n; ++i) {
            double x = wav.left[i];
            sum += x * x;
            if (i > at && ((wav.left[i - 1] < 0) != (wav.left[i] < 0)))
                ++crossings;
        }
        Window w;
        w.start = double(at) / wav.rate;
        w.rms = std::sqrt(sum / n);
        w.freq = crossings / (2.0 * windowSeconds);
        out.push_back(w);
    }
    return out;
}

// A run of windows holding one tone.
struct Run {
    int tone;        // the matching entry of tones, -1 for silence
    double start;    // seconds
    double length;   // seconds
    double rms;      // mean RMS
};

// Splits the output into runs of silence (RMS below silentRms) and of the
// given tones (a window within 6% of a tone's frequency). Windows matching
// nothing (a song change inside a window) join the run before them.
inline std::vector<Run> Runs(const Wav &wav, const std::vector<double> &tones,
                             double silentRms = 100.0, double windowSeconds = 0.05)
{
    std::vector<Run> runs;
    std::vector<Window> ws = Analyse(wav, windowSeconds);
    for (const Window &w : ws) {
        int tone = -1;
        if (w.rms >= silentRms) {
            tone = -2;
            for (size_t k = 0; k < tones.size(); ++k) {
                if (std::fabs(w.freq - tones[k]) <= 0.06 * tones[k])
                    tone = static_cast<int>(k);
            }
            if (tone == -2) {
                if (!runs.empty()) {
                    runs.back().length += windowSeconds;
                    continue;
                }
                tone = -1;
            }
        }
        if (!runs.empty() && runs.back().tone == tone) {
            Run &r = runs.back();
            r.rms = (r.rms * (r.length / windowSeconds) + w.rms) / (r.length / windowSeconds + 1);
            r.length += windowSeconds;
        } else {
            runs.push_back(Run{tone, w.start, windowSeconds, w.rms});
        }
    }
    return runs;
}

// The tone runs only, each at least minSeconds long (drops blips).
inline std::vector<Run> ToneRuns(const Wav &wav, const std::vector<double> &tones,
                                 double minSeconds = 0.2)
{
    std::vector<Run> out;
    for (const Run &r : Runs(wav, tones)) {
        if (r.tone < 0 || r.length < minSeconds)
            continue;
        if (!out.empty() && out.back().tone == r.tone &&
            r.start - (out.back().start + out.back().length) < 0.06) {
            out.back().length = r.start + r.length - out.back().start;
            continue;
        }
        out.push_back(r);
    }
    return out;
}

// Mean RMS of the output between two times (seconds).
inline double RmsBetween(const Wav &wav, double from, double to)
{
    size_t a = static_cast<size_t>(std::max(0.0, from) * wav.rate);
    size_t b = std::min(wav.left.size(), static_cast<size_t>(std::max(0.0, to) * wav.rate));
    if (b <= a)
        return 0.0;
    double sum = 0;
    for (size_t i = a; i < b; ++i)
        sum += double(wav.left[i]) * wav.left[i];
    return std::sqrt(sum / (b - a));
}

// Silence between the last audible sample before time `at` and the first
// audible sample after it, in seconds (audible: |x| > threshold).
inline double GapAround(const Wav &wav, double at, int threshold = 200)
{
    long n = static_cast<long>(wav.left.size());
    long mid = static_cast<long>(at * wav.rate);
    if (mid < 0 || mid >= n)
        return -1;
    long before = mid, after = mid;
    while (before > 0 && std::abs(wav.left[before]) <= threshold)
        --before;
    while (after < n - 1 && std::abs(wav.left[after]) <= threshold)
        ++after;
    // A sine crosses zero twice a period; those few quiet samples are not a gap.
    return double(after - before - 1) / wav.rate;
}

}  // namespace localplay

#endif
