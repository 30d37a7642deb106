// Reading what mplayer-daemon wrote to its WAV output (TARN_AUDIO_OUT=wav:PATH),
// 16-bit PCM. The test songs are sine tones: a short window's frequency comes
// from its zero crossings, its loudness from its RMS. Used by the playback
// tests and bench/localplay.cpp.
#ifndef TARN_TEST_LOCALPLAY_WAV_H
#define TARN_TEST_LOCALPLAY_WAV_H

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

namespace localplay {

struct Wav {
    int rate = 0, channels = 0;
    bool sizesFinal = false;     // RIFF and data sizes match the file
    std::vector<int16_t> left;   // first channel only
    double Seconds() const { return rate > 0 ? double(left.size()) / rate : 0.0; }
};

// Loads PATH; false when it is not 16-bit PCM. A data size that is not final
// yet (the writer still runs) reads up to the end of the file.
inline bool LoadWav(const std::string &path, Wav *wav)
{
    std::ifstream in(path, std::ios::binary);
    const std::string d((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    if (d.size() < 12 || d.compare(0, 4, "RIFF") != 0 || d.compare(8, 4, "WAVE") != 0)
        return false;
    auto u = [&](size_t at, int n) { uint32_t v = 0; memcpy(&v, d.data() + at, n); return v; };
    int bits = 0;
    for (size_t at = 12; at + 8 <= d.size();) {
        size_t size = u(at + 4, 4), body = at + 8;
        if (d.compare(at, 4, "fmt ") == 0 && body + 16 <= d.size()) {
            wav->channels = int(u(body + 2, 2));
            wav->rate = int(u(body + 4, 4));
            bits = int(u(body + 14, 2));
        } else if (d.compare(at, 4, "data") == 0) {
            if (bits != 16 || wav->channels < 1)
                return false;
            wav->sizesFinal = body + size == d.size() && u(4, 4) == d.size() - 8;
            size_t end = (body + size > d.size() || size == 0) ? d.size() : body + size;
            size_t frame = 2 * size_t(wav->channels);
            wav->left.resize((end - body) / frame);
            for (size_t i = 0; i < wav->left.size(); ++i)
                memcpy(&wav->left[i], d.data() + body + i * frame, 2);
            return true;
        }
        at = body + size + (size & 1);
    }
    return false;
}

// A run of windows holding one tone (index into tones; -1 for silence).
struct Run {
    int tone;
    double start, length, rms;   // seconds, seconds, 0..32768
};

// The runs of the given tones (a window within 6% of a tone), each at least
// minSeconds long; windows matching nothing (a song change) join the run
// before them, silence (RMS below 100) splits runs.
inline std::vector<Run> ToneRuns(const Wav &wav, const std::vector<double> &tones,
                                 double minSeconds = 0.2, double win = 0.05)
{
    std::vector<Run> runs, out;
    size_t n = size_t(win * wav.rate);
    for (size_t at = 0; n > 0 && at + n <= wav.left.size(); at += n) {
        double sum = 0;
        int crossings = 0;
        for (size_t i = at; i < at + n; ++i) {
            sum += double(wav.left[i]) * wav.left[i];
            crossings += i > at && ((wav.left[i - 1] < 0) != (wav.left[i] < 0));
        }
        double rms = std::sqrt(sum / n), freq = crossings / (2.0 * win);
        int tone = rms < 100 ? -1 : -2;
        for (size_t k = 0; tone == -2 && k < tones.size(); ++k)
            if (std::fabs(freq - tones[k]) <= 0.06 * tones[k])
                tone = int(k);
        if (tone == -2 && !runs.empty()) {
            runs.back().length += win;
            continue;
        }
        tone = std::max(tone, -1);
        if (!runs.empty() && runs.back().tone == tone) {
            Run &r = runs.back();
            r.rms = (r.rms * (r.length / win) + rms) / (r.length / win + 1);
            r.length += win;
        } else {
            runs.push_back(Run{tone, double(at) / wav.rate, win, rms});
        }
    }
    for (const Run &r : runs) {
        if (r.tone < 0 || r.length < minSeconds)
            continue;
        if (!out.empty() && out.back().tone == r.tone &&
            r.start - (out.back().start + out.back().length) < 0.06)
            out.back().length = r.start + r.length - out.back().start;
        else
            out.push_back(r);
    }
    return out;
}

// RMS of the output between two times (seconds).
inline double RmsBetween(const Wav &wav, double from, double to)
{
    size_t a = size_t(std::max(0.0, from) * wav.rate), b = std::min(wav.left.size(), size_t(to * wav.rate));
    double sum = 0;
    for (size_t i = a; i < b; ++i)
        sum += double(wav.left[i]) * wav.left[i];
    return b > a ? std::sqrt(sum / (b - a)) : 0.0;
}

}  // namespace localplay

#endif
