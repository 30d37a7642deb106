// Shared by the files of the renderer player (upnpplayer.cpp: songs, jobs
// and actions; upnpplayer_poll.cpp: the loop's turn and the published
// status): limits, job kinds and the UPnP transport state texts.
#ifndef TARN_PLAYER_UPNPPLAYER_INTERNAL_H
#define TARN_PLAYER_UPNPPLAYER_INTERNAL_H

#include <time.h>

#include "platform/tarn_clock.h"
#include "wire/tarn_wire.h"

namespace upnpplayer_internal {

const int kUrlSize = 4096;
// A job without an ending after this long is given up.
const int kJobGiveUpSeconds = 40;
// The next song is handed to the renderer this long before the end.
const int kHandNextBeforeEndSeconds = 2;

// While the renderer names the song handed ahead but its position has not
// gone back yet, the position is asked this often; by the clock, the song
// before is over this long after its end was due.
const long long kMovedOnAskMs = 200;
const long long kMovedOnGraceMs = 1500;

// What the player's job does.
enum {
    JOB_NONE = 0,
    JOB_PLAY,    // [Stop,] SetAVTransportURI, Play: the current song
    JOB_REPLAY,  // Play: "Repeat One" at the end of the song
    JOB_NEXT,    // SetNextAVTransportURI: the next song, handed ahead
    JOB_STOP,    // Stop, in order after what is in flight
};

// AVTransport's "Transition not available" fault, and how often and how
// soon a Play refused with it is sent again.
const int kTransitionNotAvailable = 701;
const int kPlayRetries = 5;
const long long kPlayRetryDelayMs = 250;

inline const char *StateText(int s)
{
    switch (s) {
    case PLAYER_STATE_STOPPED:
        return "STOPPED";
    case PLAYER_STATE_PLAYING:
        return "PLAYING";
    case PLAYER_STATE_PAUSED:
        return "PAUSED_PLAYBACK";
    case PLAYER_STATE_TRANSITIONING:
        return "TRANSITIONING";
    default:
        return nullptr;
    }
}

}  // namespace upnpplayer_internal

#endif
