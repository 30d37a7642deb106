// The local output player: plays the local queue by starting mplayer-daemon,
// commanding it over the connection it opens back to /tmp/mplayer.sock and
// following its reports in the player status segment.
#include "player/localplayer.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <climits>
#include <cstring>
#include <sys/select.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <ctime>
#include <unistd.h>

#include "audio/info.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_proc.h"
#include "player/playlist_actions.h"
#include "wire/action_table.h"

static const char kLogUnit[] = "localplayer";

namespace {

// How often the hardware mixer volume is re-read, in seconds.
const time_t kVolumeCheckSeconds = 6;

// Copies a NUL-terminated text out of a fixed field of a shared segment that
// another process may be rewriting: never reads past the field.
std::string FieldText(const char *field, size_t size)
{
    return std::string(field, strnlen(field, size));
}

int ClampVolume(int v)
{
    if (v < 0)
        return 0;
    if (v > 100)
        return 100;
    return v;
}

}  // namespace

LocalPlayer::LocalPlayer()
    : state(PLAYER_STATE_NONE),
      playlist(new Playlist()),
      duration(-1),
      position(-1),
      mplayerFd(-1),
      lastVolumeCheck(time(nullptr)),
      volume(50),
      errorCount(0),
      failSerialSeen(0),
      failedInARow(0),
      muted(false),
      startedAtMs(0)
{
    int stored = VolumeConfGet();
    if (stored != -1)
        volume = stored;
}

LocalPlayer::~LocalPlayer()
{
    CloseMplayerFd();
    delete playlist;
}

namespace {

// One action the local player takes itself; fresh: a play request. The
// action's own result does not reach the client.
struct LocalAction {
    int action;
    int (*handle)(LocalPlayer &player, const char *text, Json::Value &reply);
    bool fresh;
};

int PlayPauseAction(LocalPlayer &p, const char *, Json::Value &) { return p.PlayPause(); }
int StopAction(LocalPlayer &p, const char *, Json::Value &) { return p.Stop(); }
int NextAction(LocalPlayer &p, const char *, Json::Value &) { return p.Next(false); }
int PreviousAction(LocalPlayer &p, const char *, Json::Value &) { return p.Previous(); }
int PlayIndexAction(LocalPlayer &p, const char *text, Json::Value &) { return p.PlayIndex(text); }
int SeekAction(LocalPlayer &p, const char *text, Json::Value &) { return p.Seek(text); }
int MuteAction(LocalPlayer &p, const char *, Json::Value &) { return p.Mute(); }
int StatusAction(LocalPlayer &p, const char *, Json::Value &reply) { return p.GetStatusJson(reply); }
int EqualizerAction(LocalPlayer &p, const char *text, Json::Value &) { return p.SetEqualizer(text); }
int VolumeUpAction(LocalPlayer &p, const char *, Json::Value &) { return p.SetVolume(p.GetVolume() + 3); }
int VolumeDownAction(LocalPlayer &p, const char *, Json::Value &) { return p.SetVolume(p.GetVolume() - 3); }

int SetVolumeAction(LocalPlayer &p, const char *text, Json::Value &)
{
    return p.SetVolume(static_cast<int>(strtol(text, nullptr, 10)));
}

// The local player's own actions; the queue's (PlaylistTakesAction) go to
// the queue.
const LocalAction kLocalActions[] = {
    {ACT_PLAY_PAUSE, PlayPauseAction, true},
    {ACT_STOP, StopAction, false},
    {ACT_NEXT, NextAction, true},
    {ACT_PREVIOUS, PreviousAction, true},
    {ACT_PLAY_INDEX, PlayIndexAction, true},
    {ACT_SEEK, SeekAction, false},
    {ACT_MUTE, MuteAction, false},
    {ACT_SET_VOLUME, SetVolumeAction, false},
    {ACT_VOLUME_UP, VolumeUpAction, false},
    {ACT_VOLUME_DOWN, VolumeDownAction, false},
    {ACT_GET_STATUS, StatusAction, false},
    {ACT_SET_EQUALIZER, EqualizerAction, false},
};

}  // namespace

int LocalPlayer::HandleAction(const ControlRequest *request, Json::Value &reply)
{
    if (!request) {
        TarnLog("%s:%d Bad parameter", kLogUnit, 523);
        return -1;
    }
    // The text parameter is NUL-terminated by the client; never read past
    // the request even when it is not.
    char text[CTRL_PARAM_SIZE + 1];
    memcpy(text, request->parameter, CTRL_PARAM_SIZE);
    text[CTRL_PARAM_SIZE] = '\0';

    const LocalAction *own = FindAction(kLocalActions, request->action);
    if (own) {
        if (own->fresh) {
            // A play request starts afresh: earlier errors are history.
            lastError.clear();
            failedInARow = 0;
        }
        own->handle(*this, text, reply);
        return 0;
    }
    if (PlaylistTakesAction(request->action)) {
        PlaylistHandleAction(*playlist, request, reply);
        return 0;
    }
    TarnLog("%s:%d Action [%d] not handled", kLogUnit, 576, request->action);
    return -1;
}

// ---------------------------------------------------------------------------
// Commands to mplayer-daemon.

// ---------------------------------------------------------------------------
// Player actions.

int LocalPlayer::PlayPause()
{
    if (mplayerFd != -1 && IsMplayerAlive()) {
        static const char kPause[] = "pause";
        if (SendCommand(kPause, sizeof(kPause) - 1) != 0) {
            TLOG("Failed to send action [%s]", kPause);
            return -1;
        }
        return 0;
    }
    // The process started a moment ago is still coming up: it plays.
    if (StartPending())
        return 0;
    std::string uri;
    if (playlist->GetCurrentUri(uri) != 0) {
        TLOG("Failed to get current song in playlist.");
        return -1;
    }
    if (StartMplayer(uri) != 0) {
        TLOG("Failed to Start MPlayer with uri [%s]", uri.c_str());
        return -1;
    }
    state = PLAYER_STATE_PLAYING;
    return 0;
}

int LocalPlayer::Stop()
{
    static const char kQuit[] = "quit";
    if (SendCommand(kQuit, sizeof(kQuit) - 1) != 0) {
        TLOG("Failed to send action [%s]", kQuit);
        return -1;
    }
    for (int i = 0; i < 10; ++i) {
        if (!IsMplayerAlive())
            break;
        usleep(100 * 1000);
    }
    if (IsMplayerAlive())
        KillMplayer();
    state = PLAYER_STATE_NONE;
    CloseMplayerFd();
    return 0;
}

int LocalPlayer::Step(bool forward, bool automatic)
{
    // Stepping works only while a song is playing.
    if (mplayerFd == -1 || !IsMplayerAlive())
        return 0;

    unsigned start = playlist->Current();
    for (;;) {
        std::string uri;
        int rc = forward ? playlist->Next(uri, automatic) : playlist->Previous(uri, automatic);
        if (rc != 0)
            break;
        if (AudioIsSupportedFile(1, uri.c_str())) {
            if (LoadFile(uri) != 0) {
                TLOG("Failed to load file [%s]", uri.c_str());
                return -1;
            }
            return 0;
        }
        // Skip a song the player cannot play, until the queue comes back
        // round to where it started.
        if (playlist->Current() == start) {
            SetError("no song of the queue can be played");
            break;
        }
    }
    Stop();
    return -1;
}

int LocalPlayer::Next(bool automatic)
{
    return Step(true, automatic);
}

int LocalPlayer::Previous()
{
    return Step(false, false);
}

int LocalPlayer::PlayIndex(const char *text)
{
    if (!text) {
        TLOG("Bad parameter");
        return -1;
    }
    long index = strtol(text, nullptr, 10);
    if (index < 0)
        index = 0;
    if (playlist->SetCurrent(static_cast<unsigned>(index)) != 0) {
        TLOG("Failed to set index [%d]", static_cast<int>(index));
        return -1;
    }
    std::string uri;
    if (playlist->GetCurrentUri(uri) != 0) {
        TLOG("Failed to get current song in playlist.");
        return -1;
    }
    if (mplayerFd != -1 && IsMplayerAlive()) {
        if (LoadFile(uri) != 0) {
            TLOG("Failed to load file [%s]", uri.c_str());
            return -1;
        }
        return 0;
    }
    if (StartPending()) {
        pendingUri = uri;
        state = PLAYER_STATE_PLAYING;
        return 0;
    }
    if (PlayPause() != 0) {
        TLOG("Failed to Start Mplayer");
        return -1;
    }
    return 0;
}

int LocalPlayer::Seek(const char *text)
{
    if (!text) {
        TLOG("Bad parameter");
        return -1;
    }
    long target = strtol(text, nullptr, 10);
    if (target < 0)
        target = 0;
    if (target > INT_MAX)
        target = INT_MAX;
    // mplayer-daemon takes the offset from where it last reported to be.
    // The difference is taken in 64 bits: a huge target must not overflow.
    long long offset = static_cast<long long>(target) - position;
    if (offset > INT_MAX)
        offset = INT_MAX;
    char cmd[64];
    snprintf(cmd, sizeof(cmd), "seek %d", static_cast<int>(offset));
    if (SendPadded(cmd) != 0) {
        TLOG("Failed to send action play.");
        return -1;
    }
    return 0;
}

int LocalPlayer::SetVolume(int v)
{
    v = ClampVolume(v);
    volume = v;
    MixerSetVolumeAll(v);
    char cmd[64];
    snprintf(cmd, sizeof(cmd), "setvol %d", v);
    if (SendPadded(cmd) != 0) {
        TLOG("Failed to send action play.");
        return -1;
    }
    return 0;
}

int LocalPlayer::Mute()
{
    if (SendPadded("mute") != 0) {
        TLOG("Failed to send action play.");
        return -1;
    }
    return 0;
}

int LocalPlayer::SetEqualizer(const char *text)
{
    if (!text) {
        TLOG("Bad parameter");
        return -1;
    }
    // Cut to what the padded command buffer holds.
    std::string cmd = std::string("setequ ") + text;
    if (cmd.size() >= kPaddedCommandSize)
        cmd.resize(kPaddedCommandSize - 1);
    if (SendPadded(cmd.c_str()) != 0) {
        TLOG("Failed to send action to set equalizer.");
        return -1;
    }
    return 0;
}

// ---------------------------------------------------------------------------
// Status.

int LocalPlayer::Poll(PlayerStatusShm *segment)
{
    if (mplayerFd < 0)
        return 0;
    if (!segment) {
        TarnLog("%s:%d Shared Memory is not attached.", kLogUnit, 336);
        return -1;
    }
    volatile PlayerStatusShm *shm = segment;
    currentUri = FieldText(segment->currentUri, sizeof(segment->currentUri));
    duration = shm->duration;
    position = shm->position;
    streamTitle = FieldText(segment->streamTitle, sizeof(segment->streamTitle));
    radioStation = FieldText(segment->radioStation, sizeof(segment->radioStation));
    muted = shm->value4108 != 0;
    int32_t serial = shm->failSerial;
    if (serial != failSerialSeen) {
        failSerialSeen = serial;
        std::string why = FieldText(segment->failReason, sizeof(segment->failReason));
        if (!why.empty())
            SetError(why);
        ++failedInARow;
    }

    int32_t reported = shm->state;
    if (reported == 0)
        return 0;
    state = static_cast<uint32_t>(reported);
    if (reported == PLAYER_STATE_PLAYING && position > 0)
        failedInARow = 0;
    if (reported == PLAYER_STATE_ENDED) {
        // Written back so that the end of this song is handled once.
        shm->state = PLAYER_STATE_PLAYING;
        // Every song of the queue failed in turn (a dead station, a queue of
        // vanished files with repeat on): stop instead of trying them again
        // and again; the last error tells why.
        if (failedInARow > 0 && failedInARow >= std::max(1u, playlist->Count())) {
            TLOG("No song of the queue could be played (%u failed in a row); stopping", failedInARow);
            failedInARow = 0;
            Stop();
            state = PLAYER_STATE_STOPPED;
        } else {
            Next(true);
        }
    }

    time_t now = time(nullptr);
    if (now - lastVolumeCheck >= kVolumeCheckSeconds) {
        lastVolumeCheck = now;
        int mixer = MixerGetVolume();
        if (mixer != -1)
            volume = mixer;
    }
    return 0;
}

int LocalPlayer::PublishStatus(PublishedStatusShm *segment)
{
    if (!segment) {
        TLOG("Bad parameter");
        return -1;
    }
    if (currentUri.empty()) {
        int32_t changed = segment->changed;
        memset(segment, 0, sizeof(*segment));
        segment->shuffle = playlist->IsShuffle() ? 1 : 0;
        segment->repeatMode = playlist->GetMode();
        segment->changed = changed;
        segment->volume = volume;
        return 0;
    }

    snprintf(segment->currentUri, sizeof(segment->currentUri), "%s", currentUri.c_str());
    segment->duration = duration;
    segment->position = position;
    segment->shuffle = playlist->IsShuffle() ? 1 : 0;
    segment->repeatMode = playlist->GetMode();
    segment->state = static_cast<int32_t>(state);

    Json::Value info;
    if (PlaylistCurrentInfoJson(*playlist, info) == 0) {
        segment->index = info["current"].asInt();
        snprintf(segment->title, sizeof(segment->title), "%s", info["title"].asString().c_str());
        snprintf(segment->artist, sizeof(segment->artist), "%s",
                 info["artist"].asString().c_str());
    }
    if (!radioStation.empty()) {
        snprintf(segment->title, sizeof(segment->title), "%s", streamTitle.c_str());
        snprintf(segment->artist, sizeof(segment->artist), "%s", radioStation.c_str());
    }
    segment->volume = volume;
    return 0;
}

int LocalPlayer::GetStatusJson(Json::Value &reply)
{
    reply["PlayerState"] = static_cast<int>(state);
    reply["fdMplayer"] = mplayerFd;
    reply["CurrentUri"] = currentUri;
    reply["Duration"] = duration;
    reply["Position"] = position;
    reply["StreamTitle"] = streamTitle;
    reply["RadioStation"] = radioStation;
    reply["Volume"] = volume;
    reply["last_error"] = lastError;
    reply["error_count"] = errorCount;
    reply["Muted"] = mplayerFd >= 0 && muted;
    return 0;
}

int LocalPlayer::PollIntervalMs() const
{
    if (mplayerFd < 0)
        return -1;
    return state == PLAYER_STATE_PAUSED ? 1000 : 20;
}

void LocalPlayer::SetError(const std::string &why)
{
    lastError = why;
    ++errorCount;
}

int LocalPlayer::GetCurrentSong(std::string &path, std::string &title)
{
    Json::Value info;
    if (PlaylistCurrentInfoJson(*playlist, info) != 0)
        return -1;
    path = info["path"].asString();
    title = info["title"].asString();
    return 0;
}
