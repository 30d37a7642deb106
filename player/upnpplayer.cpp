// The renderer player: songs and their URLs, the jobs sent to the renderer
// and the control actions. The loop's turn is in upnpplayer_poll.cpp.
#include "player/upnpplayer.h"

#include <strings.h>

#include <cstdio>
#include <cstdlib>
#include <algorithm>
#include <climits>
#include <cstring>

#include "platform/media_id.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tarn_media_types.h"
#include "platform/tarn_net.h"
#include "platform/tlibc_conf.h"
#include "player/playlist_actions.h"
#include "player/upnpplayer_internal.h"
#include "upnp/upnp.h"
#include "upnp/xml_util.h"
#include "wire/action_table.h"

static const char kLogUnit[] = "upnpplayer";

using namespace upnpplayer_internal;

UpnpPlayer::UpnpPlayer(UpnpController *controller, int rendererIndex)
    : state(PLAYER_STATE_NONE),
      playlist(new Playlist()),
      volume(-1),
      mute(false),
      controller(controller),
      rendererIndex(rendererIndex),
      renderer(nullptr),
      lastSendGetInfo(time(nullptr)),
      lastCheckState(lastSendGetInfo),
      playStarted(0),
      jobId(0),
      jobKind(JOB_NONE),
      jobStarted(0),
      nextDirty(false),
      nextRefused(false),
      nextTopRel(0),
      nextDueMs(0),
      positionAskedMs(0),
      playingReportsAtStart(0),
      goneSince(0),
      wasSelected(false),
      playRetries(0),
      retryPlayAtMs(0),
      retryKind(JOB_NONE)
{
    if (!controller || rendererIndex < 0 ||
        controller->GetRenderer(static_cast<unsigned>(rendererIndex), &renderer) != 0 || !renderer) {
        TLOG("fatal error, cannot get renderer info.");
        renderer = nullptr;
    } else {
        udn = renderer->udn;
    }
    ResolveHost();
}

UpnpPlayer::~UpnpPlayer()
{
    delete playlist;
}

int UpnpPlayer::ResolveHost()
{
    TARN_NET_CARD card;
    if (TARNNetGetCard1(&card) <= 0) {
        TLOG("get network error.");
        return -1;
    }
    host = card.ip;
    char port[8] = "";
    std::string conf = TarnPath(TARN_INFO_CONF);
    if (TLIBCFileGetKeyValue(conf.c_str(), "admin_port", port, sizeof(port), 0) > 0) {
        host += ":";
        host += port;
        return 0;
    }
    return -1;
}

int UpnpPlayer::StateFromText(const std::string &text)
{
    for (int s = PLAYER_STATE_STOPPED; s <= PLAYER_STATE_TRANSITIONING; ++s) {
        if (text == StateText(s))
            return s;
    }
    return PLAYER_STATE_NONE;
}

int UpnpPlayer::SetState(int s)
{
    state = s;
    const char *text = StateText(s);
    if (text) {
        if (renderer)
            renderer->transport_state = text;
    } else {
        TLOG("SetState not handled, PlayerState [%d]", s);
    }
    lastSendGetInfo = lastCheckState = time(nullptr);
    return 0;
}

int UpnpPlayer::BuildSongUrl(const TARN_MEDIA_INFO *info, std::string &url)
{
    if (!info)
        return -1;
    char path[sizeof(info->path) + 1];
    snprintf(path, sizeof(path), "%.*s", static_cast<int>(sizeof(info->path)), info->path);
    if (strncasecmp(path, "http", 4) == 0) {
        url = path;
        return 0;
    }
    char ext[32];
    const char *known = TARNIndexExtGet(path);
    snprintf(ext, sizeof(ext), "%s", known ? known : "txt");

    char buffer[kUrlSize];
    int n;
    // Songs of the library go by their id; songs on a USB volume and songs
    // queued by path (no id) by a path token that only this installation
    // can make.
    if (TARNAudioIsUSBVolume(path) != 1 && info->id != 0) {
        char token[MEDIA_ID_TOKEN_LEN + 1];
        if (MediaIDEncryption(info->id, token, sizeof(token)) != 0) {
            TLOG("Failed to make the song id text of song [%u]", info->id);
            return -1;
        }
        n = snprintf(buffer, sizeof(buffer), "http://%s/audio/webUI/audiotransfer.cgi/%s.%s",
                     host.c_str(), token, ext);
    } else {
        std::string token = MediaPathToken(path);
        if (token.empty()) {
            TLOG("Failed to make the path token of [%s]", path);
            return -1;
        }
        n = snprintf(buffer, sizeof(buffer), "http://%s/audio/webUI/audiotransfer.cgi/ipod/%s.%s",
                     host.c_str(), token.c_str(), ext);
    }
    if (n < 0 || n >= static_cast<int>(sizeof(buffer))) {
        TLOG("Song URL too long for [%s]", path);
        return -1;
    }
    url = buffer;
    return 0;
}

int UpnpPlayer::SongUrlAndMetadata(const TARN_MEDIA_INFO *song, std::string &url,
                                   std::string &metadata)
{
    if (BuildSongUrl(song, url) != 0) {
        TLOG("Failed to convert uri for audiotransfer.cgi");
        return -1;
    }
    if (BuildDidlMetadata(song, url.c_str(), metadata) != 0) {
        TLOG("Failed to combine metadata.");
        return -1;
    }
    return 0;
}

// Starts a job on this player's renderer (the controller's current one).
int UpnpPlayer::StartJob(int kind, const std::vector<RendererAction> &steps, const std::string &url)
{
    long id = controller->StartJob(steps);
    if (id <= 0) {
        jobId = 0;
        jobKind = JOB_NONE;
        return -1;
    }
    jobId = id;
    jobKind = kind;
    jobUrl = url;
    jobStarted = time(nullptr);
    return 0;
}

// The current song is handed over and played. The steps run one after the
// other as the renderer answers them (on the controller's threads); this
// returns at once, and the poll takes the outcome: PLAYING once the
// renderer accepted Play, a logged failure otherwise.
int UpnpPlayer::PlayCurrent()
{
    TARN_MEDIA_INFO *song = new TARN_MEDIA_INFO;
    int result = -1;
    RENDERER_INFO *r = nullptr;
    std::string url, metadata;
    std::vector<RendererAction> steps;
    if (playlist->GetCurrentSong(song) != 0) {
        TLOG("Failed to get current song in playlist.");
        goto out;
    }
    if (controller->GetCurrentRenderer(&r) != 0 || !r) {
        TLOG("Failed to GetCurrentRenderer()");
        goto out;
    }
    renderer = r;
    if (SongUrlAndMetadata(song, url, metadata) != 0)
        goto out;
    // A renderer that plays is stopped first; the next action goes out when
    // it has answered, so nothing waits here.
    if (!r->transport_state.empty() && r->transport_state != "STOPPED" &&
        r->transport_state != "NO_MEDIA_PRESENT")
        steps.push_back(UpnpController::MakeAction("Stop", {"InstanceID"}, {"0"}));
    steps.push_back(UpnpController::MakeAction("SetAVTransportURI",
                                               {"InstanceID", "CurrentURI", "CurrentURIMetaData"},
                                               {"0", url, metadata}));
    steps.push_back(UpnpController::MakeAction("Play", {"InstanceID", "Speed"}, {"0", "1"}));
    playStarted = 0;
    playRetries = 0;
    retryPlayAtMs = 0;
    nextUrl.clear();
    nextDirty = false;
    nextRefused = false;
    playingReportsAtStart = r->playing_reports;
    if (StartJob(JOB_PLAY, steps, url) != 0) {
        TLOG("Failed to set current uri [%s]", url.c_str());
        lastError = "The renderer did not take the song";
        SetState(PLAYER_STATE_STOPPED);
        goto out;
    }
    // Not PLAYING until the renderer says so.
    SetState(PLAYER_STATE_TRANSITIONING);
    lastError.clear();
    result = 0;
out:
    delete song;
    return result;
}

int UpnpPlayer::PlayPause()
{
    if (state == PLAYER_STATE_PLAYING) {
        if (controller->Pause() != 0) {
            TLOG("Failed to send upnp pause");
            return -1;
        }
        SetState(PLAYER_STATE_PAUSED);
    } else if (state == PLAYER_STATE_PAUSED) {
        if (controller->Play() != 0) {
            TLOG("Failed to send upnp play");
            return -1;
        }
        SetState(PLAYER_STATE_PLAYING);
        // The song before the one handed ahead ends later by the pause.
        if (!nextUrl.empty() && renderer)
            ExpectNextAfter(renderer->rel_time);
    } else {
        return PlayCurrent();
    }
    playStarted = 1;
    return 0;
}

int UpnpPlayer::Stop()
{
    // After whatever is in flight, so that a Play on its way cannot follow.
    controller->CancelJob();
    retryPlayAtMs = 0;
    std::vector<RendererAction> steps;
    steps.push_back(UpnpController::MakeAction("Stop", {"InstanceID"}, {"0"}));
    int r = StartJob(JOB_STOP, steps, std::string());
    SetState(PLAYER_STATE_STOPPED);
    playStarted = 0;
    nextUrl.clear();
    return r;
}

int UpnpPlayer::Next(bool automatic)
{
    if (automatic && playlist->GetMode() == REPEAT_MODE_ONE) {
        // The renderer still holds the song: play it again. When it refuses,
        // the song is handed over again (FinishJob).
        std::vector<RendererAction> steps;
        steps.push_back(UpnpController::MakeAction("Play", {"InstanceID", "Speed"}, {"0", "1"}));
        playStarted = 0;
        if (renderer)
            playingReportsAtStart = renderer->playing_reports;
        if (StartJob(JOB_REPLAY, steps, playingUrl) != 0) {
            TLOG("Failed to send upnp play");
            PlayCurrent();
        }
        return -1;
    }
    std::string uri;
    if (playlist->Next(uri, false) != 0)
        Stop();
    else
        PlayCurrent();
    return -1;
}

int UpnpPlayer::Previous(bool automatic)
{
    std::string uri;
    if (playlist->Previous(uri, automatic) != 0)
        Stop();
    else
        PlayCurrent();
    return -1;
}

int UpnpPlayer::PlayIndex(const char *text)
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
    return PlayCurrent();
}

int UpnpPlayer::Seek(const char *text)
{
    if (!text) {
        TLOG("Bad parameter");
        return -1;
    }
    int position = static_cast<int>(strtol(text, nullptr, 10));
    if (controller->Seek(position) != 0) {
        TLOG("Failed to seek [%s]", text);
        return -1;
    }
    // A position gone back is not the move to the song handed ahead.
    if (!nextUrl.empty() && renderer) {
        renderer->rel_time = position;
        ExpectNextAfter(position);
    }
    return 0;
}

int UpnpPlayer::EstimateRelTime(int seconds)
{
    if (seconds < 1)
        return 0;
    if (state != PLAYER_STATE_PLAYING)
        return seconds;
    return seconds + static_cast<int>(time(nullptr) - lastSendGetInfo);
}

int UpnpPlayer::GetStatusJson(Json::Value &reply)
{
    if (controller->GetRendererState(reply) != 0) {
        reply["error"] = "Failed to get UPnP Renderer Info";
        return -1;
    }
    reply["playerMute"] = mute;
    reply["playerVolume"] = volume;
    reply["last_send_get_info"] = static_cast<Json::Int64>(lastSendGetInfo);
    reply["last_check_state"] = static_cast<Json::Int64>(lastCheckState);
    reply["RelTime"] = EstimateRelTime(reply.get("RelTime", 0).asInt());
    reply["last_error"] = lastError;
    return 0;
}

// ACT_SET_VOLUME (clamped to 0..100), ACT_VOLUME_UP and ACT_VOLUME_DOWN.
void UpnpPlayer::ChangeVolume(int code, const char *text)
{
    if (code == ACT_SET_VOLUME) {
        long v = strtol(text, nullptr, 10);
        if (v < 0)
            v = 0;
        if (v > 100)
            v = 100;
        controller->SetVolume(static_cast<int>(v));
        return;
    }
    // Not clamped to 0..100, but a renderer reporting an absurd volume
    // must not make the step overflow.
    long long v = static_cast<long long>(volume) + (code == ACT_VOLUME_UP ? 3 : -3);
    controller->SetVolume(static_cast<int>(std::max<long long>(INT_MIN, std::min<long long>(INT_MAX, v))));
}

// The handlers of the renderer player's own actions. Each returns what the
// client's request returns: 0 whatever the action did, or the status's own
// result.
struct UpnpPlayerActions {
    static int PlayPause(UpnpPlayer &p, int, const char *, Json::Value &) { p.PlayPause(); return 0; }
    static int Stop(UpnpPlayer &p, int, const char *, Json::Value &) { p.Stop(); return 0; }
    static int Next(UpnpPlayer &p, int, const char *, Json::Value &) { p.Next(false); return 0; }
    static int Previous(UpnpPlayer &p, int, const char *, Json::Value &) { p.Previous(false); return 0; }
    static int PlayIndex(UpnpPlayer &p, int, const char *text, Json::Value &) { p.PlayIndex(text); return 0; }
    static int Seek(UpnpPlayer &p, int, const char *text, Json::Value &) { p.Seek(text); return 0; }
    static int Status(UpnpPlayer &p, int, const char *, Json::Value &reply) { return p.GetStatusJson(reply); }

    static int Mute(UpnpPlayer &p, int, const char *, Json::Value &)
    {
        p.controller->SetMute(!p.mute);
        return 0;
    }

    static int Volume(UpnpPlayer &p, int code, const char *text, Json::Value &)
    {
        p.ChangeVolume(code, text);
        return 0;
    }
};

namespace {

struct RendererPlayerAction {
    int action;
    int (*handle)(UpnpPlayer &p, int code, const char *text, Json::Value &reply);  // nullptr: refused
};

// The renderer player's own actions; the queue's (PlaylistTakesAction) go to
// the queue.
const RendererPlayerAction kRendererPlayerActions[] = {
    {ACT_PLAY_PAUSE, UpnpPlayerActions::PlayPause},
    {ACT_STOP, UpnpPlayerActions::Stop},
    {ACT_NEXT, UpnpPlayerActions::Next},
    {ACT_PREVIOUS, UpnpPlayerActions::Previous},
    {ACT_PLAY_INDEX, UpnpPlayerActions::PlayIndex},
    {ACT_SEEK, UpnpPlayerActions::Seek},
    {ACT_MUTE, UpnpPlayerActions::Mute},
    {ACT_SET_VOLUME, UpnpPlayerActions::Volume},
    {ACT_VOLUME_UP, UpnpPlayerActions::Volume},
    {ACT_VOLUME_DOWN, UpnpPlayerActions::Volume},
    {ACT_GET_STATUS, UpnpPlayerActions::Status},
    // One of the queue's actions, refused here: the renderer player does
    // not cycle the repeat mode (nor does it set the equalizer, which is in
    // no table of its).
    {ACT_CYCLE_REPEAT_MODE, nullptr},
};

}  // namespace

int UpnpPlayer::HandleAction(const ControlRequest *request, Json::Value &reply)
{
    if (!request) {
        TLOG("Bad parameter");
        return -1;
    }
    if (!controller) {
        TLOG("No UPnP Control");
        return -1;
    }
    int code = request->action;
    const char *text = request->parameter;
    int result = 0;
    controller->Lock();
    // The record may have been replaced since the last turn.
    RENDERER_INFO *r = nullptr;
    int index = controller->FindRendererByUdn(udn);
    if (index >= 0 && controller->GetRenderer(static_cast<unsigned>(index), &r) == 0)
        renderer = r;
    else
        renderer = nullptr;
    const RendererPlayerAction *own = FindAction(kRendererPlayerActions, code);
    if (own && own->handle) {
        result = own->handle(*this, code, text, reply);
    } else if (!own && PlaylistTakesAction(code)) {
        PlaylistHandleAction(*playlist, request, reply);
        // The song handed ahead may no longer be the one that follows.
        if (code != ACT_QUEUE_LIST)
            nextDirty = true;
    } else {
        TarnLog("%s:%d Action [%d] not handled", kLogUnit, 739, code);
        result = -1;
    }
    controller->Unlock();
    return result;
}
