// Faults of the player process, seen from the daemon: mplayer-daemon killed
// mid-song again and again, stopped so that its connection fills up, and a
// player program that starts but never connects. Through all of them the
// daemon answers every request within a second, keeps no descriptor of a
// dead player and leaves no player process behind.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <functional>
#include <set>
#include <sstream>
#include <string>
#include <thread>

#include <json/json.h>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

using tarntest::Harness;
using tarntest::MakeMediaInfo;

long NowMs()
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(
               std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

bool WaitFor(const std::function<bool()> &pred, int timeoutMs)
{
    long end = NowMs() + timeoutMs;
    while (NowMs() < end) {
        if (pred())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return pred();
}

// A mono 16-bit WAV of a sine tone.
std::string Wav(int seconds, int hz)
{
    const int rate = 8000, n = rate * seconds;
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
        u16(static_cast<uint16_t>(static_cast<int16_t>(6000 * sin(2 * M_PI * hz * i / rate))));
    return d;
}

class PlayerFaults : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
        h.reset(new Harness());
        ASSERT_EQ(0, h->WriteFile("/share/Music/long.wav", Wav(20, 440)));
        ASSERT_EQ(0, h->WriteFile("/share/Music/short.wav", Wav(2, 660)));
    }

    void TearDown() override
    {
        if (HasFailure() && h)
            fprintf(stderr, "--- daemon log ---\n%s\n", h->Log().c_str());
        h.reset();
    }

    // Status within a second; null when no reply came in time.
    Json::Value Status()
    {
        std::string text;
        Json::Value v;
        if (h->Request(ACT_GET_STATUS, nullptr, &text, 1000) != 0)
            return v;
        Json::Reader().parse(text, v);
        return v;
    }

    // A request answered within a second, with its time in *ms.
    bool Quick(int action, const char *param, long *ms = nullptr)
    {
        long t0 = NowMs();
        int rc = h->Request(action, param, nullptr, 1000);
        if (ms)
            *ms = NowMs() - t0;
        return rc == 0;
    }

    int PlayerPid() { return atoi(h->ReadFile(TARN_MPLAYER_PID_FILE).c_str()); }

    void AddSongs()
    {
        ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(h->Path("/share/Music/long.wav"), "Long", "Band", 20.0f)));
        ASSERT_EQ(0, h->QueueAdd(MakeMediaInfo(h->Path("/share/Music/short.wav"), "Short", "Band", 2.0f)));
    }

    std::unique_ptr<Harness> h;
};

// Killed with SIGKILL mid-song six times over: every request is answered
// within a second, each play starts a fresh player that connects, and at
// the end the daemon holds exactly the descriptors it held before the first
// song (a dead player's connection is never kept).
TEST_F(PlayerFaults, PlayerKilledMidSongAgainAndAgain)
{
    ASSERT_EQ(0, access(tarntest::BinPath("mplayer-daemon").c_str(), X_OK))
        << "build the mplayer-daemon target first";
    ASSERT_EQ(0, h->Start()) << h->Error();
    AddSongs();
    int fdsBefore = tarntest::CountFds(h->Pid());
    ASSERT_GT(fdsBefore, 0);

    std::set<int> killed;
    for (int round = 0; round < 6; ++round) {
        SCOPED_TRACE(round);
        ASSERT_TRUE(Quick(ACT_PLAY_INDEX, "0"));
        // A new player of its own, connected and into the song.
        int pid = 0;
        ASSERT_TRUE(WaitFor([&] {
            pid = PlayerPid();
            return pid > 0 && killed.count(pid) == 0 && kill(pid, 0) == 0;
        }, 8000)) << "no new mplayer-daemon";
        ASSERT_TRUE(WaitFor([&] { return Status()["fdMplayer"].asInt() >= 0; }, 8000))
            << "mplayer-daemon did not connect";
        std::this_thread::sleep_for(std::chrono::milliseconds(700));
        ASSERT_EQ(0, kill(pid, SIGKILL));
        killed.insert(pid);
        ASSERT_TRUE(WaitFor([&] { h->Reap(); return kill(pid, 0) != 0; }, 3000));
        // Commands to a dead player: each answered at once.
        for (int action : {ACT_SET_VOLUME, ACT_SEEK, ACT_MUTE, ACT_MUTE, ACT_VOLUME_UP}) {
            long ms = 0;
            EXPECT_TRUE(Quick(action, "5", &ms)) << "action " << action;
            EXPECT_LT(ms, 1000) << "action " << action;
        }
        EXPECT_TRUE(Status().isObject());
    }
    ASSERT_TRUE(Quick(ACT_STOP, nullptr));
    ASSERT_TRUE(WaitFor([&] {
        h->Reap();
        Json::Value s = Status();
        // A killed player leaves its pid file; it must name no living process.
        int left = PlayerPid();
        return s.isObject() && s["fdMplayer"].asInt() == -1 && (left <= 0 || kill(left, 0) != 0);
    }, 10000));
    EXPECT_EQ(fdsBefore, tarntest::CountFds(h->Pid()));
    EXPECT_EQ(0, h->Stop());
}

// Stopped with SIGSTOP while playing: the connection stops draining. A
// burst of requests of every player kind, the padded ones that fill the
// connection first, is answered request by request within a second; after
// SIGCONT the same player takes commands again and the daemon still holds
// its connection.
TEST_F(PlayerFaults, StoppedPlayerNeverHoldsTheLoop)
{
    ASSERT_EQ(0, access(tarntest::BinPath("mplayer-daemon").c_str(), X_OK))
        << "build the mplayer-daemon target first";
    ASSERT_EQ(0, h->Start()) << h->Error();
    AddSongs();
    ASSERT_TRUE(Quick(ACT_PLAY_INDEX, "0"));
    ASSERT_TRUE(WaitFor([&] { return Status()["Position"].asInt() >= 1; }, 8000));
    int pid = PlayerPid();
    ASSERT_GT(pid, 0);
    ASSERT_EQ(0, kill(pid, SIGSTOP));

    long worst = 0;
    const int kinds[] = {ACT_SET_EQUALIZER, ACT_SET_VOLUME, ACT_SEEK, ACT_MUTE,
                         ACT_VOLUME_UP,     ACT_VOLUME_DOWN, ACT_GET_STATUS, ACT_QUEUE_LIST};
    for (int i = 0; i < 400; ++i) {
        int action = kinds[i % 8];
        const char *param = action == ACT_SET_EQUALIZER ? "1.0 2.0 3.0 0.0 0.0 0.0 0.0 0.0 0.0 -3.0"
                            : action == ACT_QUEUE_LIST  ? "0 10"
                                                        : "20";
        long ms = 0;
        ASSERT_TRUE(Quick(action, param, &ms)) << "request " << i << " (action " << action << ")";
        worst = std::max(worst, ms);
    }
    EXPECT_LT(worst, 1000);
    printf("400 requests to a stopped player's daemon: slowest reply %ld ms\n", worst);

    ASSERT_EQ(0, kill(pid, SIGCONT));
    // The player was never dropped for being slow; it takes commands again.
    ASSERT_TRUE(WaitFor([&] { return Status()["fdMplayer"].asInt() >= 0; }, 3000));
    EXPECT_TRUE(Quick(ACT_SET_VOLUME, "30"));
    EXPECT_TRUE(WaitFor([&] { return Status()["Volume"].asInt() == 30; }, 3000));
    EXPECT_EQ(pid, PlayerPid());
    ASSERT_TRUE(Quick(ACT_STOP, nullptr));
    ASSERT_TRUE(WaitFor([&] { h->Reap(); return kill(pid, 0) != 0; }, 10000));
    EXPECT_EQ(0, h->Stop());
}

// A player program that starts, writes its pid file and never connects.
// Every play request is answered within a second, the status shows no
// connection, each new play ends the previous hanging player (at most one
// lives at a time) and stopping the daemon ends the last one.
TEST_F(PlayerFaults, PlayerThatNeverConnects)
{
    // Replaces the copy the harness put there.
    std::string script =
        "#!/bin/sh\n"
        "echo $$ >> \"$TARN_ROOT/fake-players\"\n"
        "echo $$ > \"$TARN_ROOT" TARN_MPLAYER_PID_FILE "\"\n"
        "exec sleep 60\n";
    std::string bin = h->Path(TARN_MPLAYER_BIN);
    unlink(bin.c_str());
    ASSERT_EQ(0, h->WriteFile(TARN_MPLAYER_BIN, script));
    ASSERT_EQ(0, chmod(bin.c_str(), 0755));
    ASSERT_EQ(0, h->Start()) << h->Error();
    AddSongs();

    auto living = [&] {
        h->Reap();
        std::istringstream in(h->ReadFile("/fake-players"));
        std::set<int> alive;
        int pid;
        while (in >> pid) {
            if (kill(pid, 0) == 0 && h->Reaped().count(pid) == 0)
                alive.insert(pid);
        }
        return alive;
    };
    for (int round = 0; round < 5; ++round) {
        SCOPED_TRACE(round);
        long ms = 0;
        ASSERT_TRUE(Quick(ACT_PLAY_INDEX, round % 2 ? "1" : "0", &ms));
        EXPECT_LT(ms, 1000);
        // The new program is running; the previous one has been ended.
        ASSERT_TRUE(WaitFor([&] {
            std::istringstream in(h->ReadFile("/fake-players"));
            int n = 0, pid;
            while (in >> pid)
                n++;
            return n >= round + 1;
        }, 3000));
        EXPECT_TRUE(WaitFor([&] { return living().size() == 1; }, 3000))
            << living().size() << " hanging players alive";
        Json::Value s = Status();
        ASSERT_TRUE(s.isObject());
        EXPECT_EQ(-1, s["fdMplayer"].asInt());
        for (int action : {ACT_SET_VOLUME, ACT_SEEK, ACT_MUTE, ACT_SET_EQUALIZER})
            EXPECT_TRUE(Quick(action, "10")) << "action " << action;
    }
    EXPECT_EQ(0, h->Stop());
    EXPECT_TRUE(WaitFor([&] { return living().empty(); }, 5000))
        << living().size() << " hanging players left after the daemon stopped";
}

}  // namespace
