// The renderer player's part of the loop's turn: jobs that ended, the next
// song handed ahead, renderers gone and back, the poll and the published status.
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

static const char kLogUnit[] = "upnpplayer";

using namespace upnpplayer_internal;

// The poll found the player's job ended.
void UpnpPlayer::FinishJob(RENDERER_INFO *r)
{
    int kind = jobKind;
    std::string url = jobUrl;
    bool ok = r->job_error == 0;
    jobId = 0;
    jobKind = JOB_NONE;
    switch (kind) {
    case JOB_PLAY:
    case JOB_REPLAY:
        if (ok) {
            playRetries = 0;
            playingUrl = url.empty() ? playingUrl : url;
            SetState(PLAYER_STATE_PLAYING);
            playStarted = 1;
            // Without events, only answers asked from now on tell that it
            // played.
            if (!r->transport_events)
                playingReportsAtStart = r->playing_reports;
            break;
        }
        if (r->job_failed == "Play" && r->job_error == kTransitionNotAvailable &&
            playRetries < kPlayRetries) {
            // Still between two states (loading the song, say): Play is
            // sent again shortly.
            ++playRetries;
            retryPlayAtMs = TarnNowMs() + kPlayRetryDelayMs;
            retryKind = kind;
            jobUrl = url;
            break;
        }
        if (kind == JOB_REPLAY) {
            // The renderer forgot the song at its end (some clear their
            // URI): it is handed over again at once.
            PlayCurrent();
            break;
        }
        if (r->job_failed == "SetAVTransportURI")
            TLOG("Failed to set current uri [%s]", url.c_str());
        else if (r->job_failed == "Stop")
            TLOG("Failed to send upnp stop");
        else
            TLOG("Failed to send upnp play");
        lastError = "The renderer refused " + r->job_failed + " (" + std::to_string(r->job_error) + ")";
        playStarted = 0;
        SetState(PLAYER_STATE_STOPPED);
        break;
    case JOB_NEXT:
        if (ok) {
            nextUrl = url;
            if (!url.empty())
                ExpectNextAfter(r->rel_time);
        } else {
            TLOG("Failed to set next uri [%s]", url.c_str());
            nextRefused = true;
        }
        break;
    default:
        break;
    }
}

// Hands the song that follows to the renderer, so that it moves on by
// itself without a gap. An empty URI withdraws one handed before.
int UpnpPlayer::HandNext(RENDERER_INFO *r)
{
    nextDirty = false;
    unsigned entry = 0;
    std::string url, metadata;
    if (playlist->GetMode() != REPEAT_MODE_ONE && playlist->PeekNext(&entry) == 0) {
        const QueueEntry *e = playlist->Entry(entry);
        TARN_MEDIA_INFO *song = new TARN_MEDIA_INFO;
        e->ToMediaInfo(song);
        int rc = SongUrlAndMetadata(song, url, metadata);
        delete song;
        if (rc != 0) {
            nextRefused = true;
            return -1;
        }
    }
    if (url == nextUrl)
        return 0;
    std::vector<RendererAction> steps;
    steps.push_back(UpnpController::MakeAction("SetNextAVTransportURI",
                                               {"InstanceID", "NextURI", "NextURIMetaData"},
                                               {"0", url, metadata}));
    nextUrl.clear();
    if (StartJob(JOB_NEXT, steps, url) != 0) {
        nextRefused = true;
        return -1;
    }
    return 0;
}

// The song handed ahead is due after the rest of the playing one, which is
// at position (seconds, as the renderer last told); the furthest position
// seen starts there.
void UpnpPlayer::ExpectNextAfter(int position)
{
    nextTopRel = position;
    int now = EstimateRelTime(position);
    int left = renderer && renderer->duration > now ? renderer->duration - now : 0;
    nextDueMs = TarnNowMs() + left * 1000LL + kMovedOnGraceMs;
}

// True once the renderer plays the song handed ahead: it names it, and its
// position went back to the start (or the song before is over by the
// clock). Naming it alone is not enough: some renderers do as soon as they
// have it. (A position a little lower than the furthest is not enough
// either: two answers can come in the other order.)
bool UpnpPlayer::MovedOnToNext(RENDERER_INFO *r)
{
    if (nextUrl.empty() || nextUrl == playingUrl)
        return false;
    bool named = r->current_uri == nextUrl;
    if (named && r->rel_time < nextTopRel && r->rel_time <= 1)
        return true;
    nextTopRel = std::max(nextTopRel, r->rel_time);
    if (!named)
        return false;
    long long now = TarnNowMs();
    if (state == PLAYER_STATE_PLAYING && now >= nextDueMs)
        return true;
    if (now - positionAskedMs >= kMovedOnAskMs) {
        positionAskedMs = now;
        controller->GetPositionInfo();
    }
    return false;
}

// The renderer went on to the song handed ahead: the queue follows. The
// renderer plays it already, so the count of PLAYING reports stays where
// it was: its next STOPPED is this song's end.
void UpnpPlayer::FollowNext()
{
    std::string uri;
    playlist->Next(uri, true);
    playingUrl = nextUrl;
    nextUrl.clear();
    SetState(PLAYER_STATE_PLAYING);
    playStarted = 1;
}

void UpnpPlayer::OnRendererGone(bool selected)
{
    goneSince = time(nullptr);
    wasSelected = selected;
    renderer = nullptr;
    rendererIndex = -1;
    state = PLAYER_STATE_NONE;
    playStarted = 0;
    jobId = 0;
    jobKind = JOB_NONE;
    nextUrl.clear();
    lastError = "The renderer left the network";
}

void UpnpPlayer::OnRendererBack(int index)
{
    goneSince = 0;
    rendererIndex = index;
    RENDERER_INFO *r = nullptr;
    if (controller->GetRenderer(static_cast<unsigned>(index), &r) == 0)
        renderer = r;
    lastSendGetInfo = lastCheckState = time(nullptr);
    lastError.clear();
}

int UpnpPlayer::Poll()
{
    if (!renderer || !controller)
        return -1;
    int index = controller->FindRendererByUdn(udn);
    if (index < 0 || index != rendererIndex)
        return -1;
    RENDERER_INFO *r = nullptr;
    if (controller->GetRenderer(static_cast<unsigned>(index), &r) != 0 || !r)
        return -1;
    renderer = r;

    if (retryPlayAtMs != 0 && jobKind == JOB_NONE && TarnNowMs() >= retryPlayAtMs) {
        retryPlayAtMs = 0;
        std::vector<RendererAction> steps;
        steps.push_back(UpnpController::MakeAction("Play", {"InstanceID", "Speed"}, {"0", "1"}));
        if (StartJob(retryKind, steps, jobUrl) != 0) {
            lastError = "The renderer did not take Play";
            SetState(PLAYER_STATE_STOPPED);
        }
    }
    if (jobKind != JOB_NONE && r->job_done == static_cast<uint32_t>(jobId)) {
        FinishJob(r);
    } else if (jobKind != JOB_NONE && time(nullptr) - jobStarted > kJobGiveUpSeconds) {
        // No answer came (libupnp answers every request, if only with a
        // time-out; this is the player's own bound).
        TLOG("Renderer [%s] did not answer [%s]", udn.c_str(), r->job_sent.c_str());
        if (jobKind == JOB_PLAY || jobKind == JOB_REPLAY) {
            lastError = "The renderer did not answer";
            playStarted = 0;
            SetState(PLAYER_STATE_STOPPED);
        }
        jobId = 0;
        jobKind = JOB_NONE;
    }

    int s = StateFromText(r->transport_state);
    if (s == PLAYER_STATE_NONE)
        return 0;
    // While the song is being handed over the renderer's own state (the
    // stop before it, say) is not the player's.
    if (jobKind != JOB_PLAY && jobKind != JOB_REPLAY)
        state = s;
    mute = strtol(r->mute.c_str(), nullptr, 10) != 0;
    volume = static_cast<int32_t>(strtol(r->volume.c_str(), nullptr, 10));

    time_t now = time(nullptr);
    if (now - lastSendGetInfo > 0) {
        lastSendGetInfo = now;
        controller->GetPositionInfo();
        controller->GetTransportInfo();
    }
    if (playStarted == 1 && jobKind == JOB_NONE) {
        bool played = r->playing_reports != playingReportsAtStart;
        if (MovedOnToNext(r)) {
            FollowNext();
        } else if (state == PLAYER_STATE_STOPPED && played) {
            // It played and stopped: the song ended (the renderer said so
            // in an event or an answer). The queue moves on at once.
            lastCheckState = now;
            Next(true);
        } else if (r->can_set_next && played && state == PLAYER_STATE_PLAYING && !nextRefused &&
                   (nextDirty || nextUrl.empty()) && r->duration > 0 &&
                   EstimateRelTime(r->rel_time) >= r->duration - kHandNextBeforeEndSeconds) {
            // Handed in the song's last seconds: some renderers announce the
            // next song as soon as they have it buffered, long before they
            // play it; this late, they switch when the song ends.
            HandNext(r);
        }
    }
    // For renderers that tell nothing: every 6 seconds at most.
    if (now - lastCheckState >= 6) {
        lastCheckState = now;
        if (playStarted == 1 && jobKind == JOB_NONE && state == PLAYER_STATE_STOPPED)
            Next(true);
    }
    return 0;
}

int UpnpPlayer::PublishStatus(PublishedStatusShm *segment)
{
    if (!segment) {
        TLOG("Bad parameter");
        return -1;
    }
    if (!controller)
        return -1;
    controller->Lock();
    RENDERER_INFO *r = nullptr;
    int index = controller->FindRendererByUdn(udn);
    if (index < 0 || controller->GetRenderer(static_cast<unsigned>(index), &r) != 0 || !r)
        r = nullptr;
    else
        renderer = r;
    int32_t rendererVolume = r ? static_cast<int32_t>(strtol(r->volume.c_str(), nullptr, 10)) : 0;
    // A renderer that left plays nothing for us: state 0, texts cleared.
    if (!r || (state != PLAYER_STATE_PLAYING && state != PLAYER_STATE_PAUSED)) {
        int32_t changed = segment->changed;
        memset(segment, 0, sizeof(*segment));
        segment->changed = changed;
        segment->volume = rendererVolume;
        segment->shuffle = playlist->IsShuffle() ? 1 : 0;
        segment->repeatMode = playlist->GetMode();
        controller->Unlock();
        return 0;
    }
    snprintf(segment->currentUri, sizeof(segment->currentUri), "%s", r->current_uri.c_str());
    segment->duration = r->duration;
    segment->position = r->rel_time;
    segment->volume = rendererVolume;
    segment->shuffle = playlist->IsShuffle() ? 1 : 0;
    segment->repeatMode = playlist->GetMode();
    segment->state = state;
    Json::Value info;
    if (PlaylistCurrentInfoJson(*playlist, info) == 0) {
        if (info.isMember("current"))
            segment->index = info["current"].asInt();
        if (info.isMember("title"))
            snprintf(segment->title, sizeof(segment->title), "%s", info["title"].asCString());
        if (info.isMember("artist"))
            snprintf(segment->artist, sizeof(segment->artist), "%s", info["artist"].asCString());
    }
    controller->Unlock();
    return 0;
}
