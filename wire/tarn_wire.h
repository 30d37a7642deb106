// The wire formats every process shares: the control request and reply with
// the action codes, both status segment layouts and the player states.
// Layouts are fixed byte for byte; the static_asserts below guard them.
// This folder includes nothing of the system's own.
#ifndef TARN_WIRE_H
#define TARN_WIRE_H

#include <cstddef>
#include <cstdint>


// ---------------------------------------------------------------------------
// Control protocol: one 8196-byte request, one 8192-byte reply per connection.
enum {
    ACT_SOURCE_RANDOM = 1,
    ACT_SOURCE_RADIO = 2,
    ACT_SOURCE_IPOD = 3,
    ACT_PLAY_PAUSE = 4,
    ACT_STOP = 5,
    ACT_NEXT = 6,
    ACT_PREVIOUS = 7,
    ACT_PLAY_INDEX = 8,
    ACT_SEEK = 9,
    ACT_MUTE = 10,
    ACT_SET_VOLUME = 11,
    ACT_VOLUME_UP = 12,
    ACT_VOLUME_DOWN = 13,
    ACT_SEARCH_SERVERS = 14,
    ACT_SEARCH_RENDERERS = 15,
    ACT_LIST_SERVERS = 16,
    ACT_LIST_RENDERERS = 17,
    ACT_SELECT_PLAYER = 18,
    ACT_GET_STATUS = 19,
    ACT_QUEUE_ADD = 20,
    ACT_QUEUE_REMOVE = 21,
    ACT_QUEUE_CLEAR = 22,
    ACT_QUEUE_INSERT = 23,
    ACT_QUEUE_SET_CURRENT = 24,
    ACT_SET_REPEAT_MODE = 25,
    ACT_TOGGLE_SHUFFLE = 26,
    ACT_QUEUE_LIST = 27,
    ACT_CLEAR_CHANGED = 28,
    ACT_SET_CHANGED = 29,
    ACT_CYCLE_REPEAT_MODE = 30,
    ACT_SOURCE_PLAYLIST = 31,
    ACT_SOURCE_CUSTOM = 32,
    ACT_SOURCE_NEXT = 33,
    ACT_SOURCE_PREVIOUS = 34,
    ACT_SET_EQUALIZER = 35,
    ACT_SAVE_CUSTOM = 36,
};

#define CTRL_PARAM_SIZE 8192
#define CTRL_REQUEST_SIZE 8196
#define CTRL_REPLY_SIZE 8192
// ACT_QUEUE_INSERT carries its position as an int32 at this request offset.
#define CTRL_INSERT_POS_OFFSET 6308

struct ControlRequest {
    int32_t action;
    char parameter[CTRL_PARAM_SIZE];
};
static_assert(sizeof(ControlRequest) == CTRL_REQUEST_SIZE, "ControlRequest size");
static_assert(offsetof(ControlRequest, parameter) == 4, "parameter offset");

// ---------------------------------------------------------------------------
// Shared status memory.
#define TARN_SHM_KEY_PLAYER_DEFAULT 25521815
#define TARN_SHM_KEY_PUBLISHED_DEFAULT 25521816
#define TARN_SHM_PLAYER_SIZE 13104
#define TARN_SHM_PUBLISHED_SIZE 4640

// Player status segment, written by mplayer-daemon.
struct PlayerStatusShm {
    char unused0[4104];          // 0
    int32_t value4104;           // 4104
    int32_t value4108;           // 4108
    int32_t state;               // 4112 player state (5: song ended)
    int32_t value4116;           // 4116
    char currentUri[4096];       // 4120
    int32_t duration;            // 8216
    int32_t position;            // 8220
    // Why the last song could not be played, written by mplayer-daemon
    // before it reports the song as ended; failSerial counts the reports
    // (0 when the process starts), so a reader sees each one once.
    int32_t failSerial;          // 8224
    char failReason[1020];       // 8228
    char unused9248[3080];       // 9248
    char radioStation[512];      // 12328
    char streamTitle[264];       // 12840
};
static_assert(sizeof(PlayerStatusShm) == TARN_SHM_PLAYER_SIZE, "player segment size");
static_assert(offsetof(PlayerStatusShm, state) == 4112, "state");
static_assert(offsetof(PlayerStatusShm, currentUri) == 4120, "currentUri");
static_assert(offsetof(PlayerStatusShm, duration) == 8216, "duration");
static_assert(offsetof(PlayerStatusShm, position) == 8220, "position");
static_assert(offsetof(PlayerStatusShm, failSerial) == 8224, "failSerial");
static_assert(offsetof(PlayerStatusShm, radioStation) == 12328, "radioStation");
static_assert(offsetof(PlayerStatusShm, streamTitle) == 12840, "streamTitle");

// Published status segment, written by the daemon every loop turn.
struct PublishedStatusShm {
    char currentUri[4096];       // 0
    int32_t duration;            // 4096
    int32_t position;            // 4100
    int32_t volume;              // 4104
    int32_t index;               // 4108
    int32_t state;               // 4112
    char title[255];             // 4116
    char artist[255];            // 4371
    char padding[2];             // 4626
    int32_t changed;             // 4628
    int32_t shuffle;             // 4632
    int32_t repeatMode;          // 4636
};
static_assert(sizeof(PublishedStatusShm) == TARN_SHM_PUBLISHED_SIZE, "published segment size");
static_assert(offsetof(PublishedStatusShm, volume) == 4104, "volume");
static_assert(offsetof(PublishedStatusShm, index) == 4108, "index");
static_assert(offsetof(PublishedStatusShm, state) == 4112, "state");
static_assert(offsetof(PublishedStatusShm, title) == 4116, "title");
static_assert(offsetof(PublishedStatusShm, artist) == 4371, "artist");
static_assert(offsetof(PublishedStatusShm, changed) == 4628, "changed");
static_assert(offsetof(PublishedStatusShm, shuffle) == 4632, "shuffle");
static_assert(offsetof(PublishedStatusShm, repeatMode) == 4636, "repeatMode");

// Player states shared by both players and the published segment.
enum {
    PLAYER_STATE_NONE = 0,
    PLAYER_STATE_STOPPED = 1,
    PLAYER_STATE_PLAYING = 2,
    PLAYER_STATE_PAUSED = 3,
    PLAYER_STATE_TRANSITIONING = 4,
    PLAYER_STATE_ENDED = 5,
};

// Repeat modes of a queue, as the published segment's repeatMode and
// ACT_SET_REPEAT_MODE carry them. 0 is no mode (refused when set).
enum {
    REPEAT_MODE_NONE = 0,
    REPEAT_MODE_OFF = 1,   // stop after the last song ("Normal")
    REPEAT_MODE_ONE = 2,   // play the song again when it ends
    REPEAT_MODE_ALL = 3,   // start the queue again after the last song
};

// Kinds of source the local queue was last filled from (there is no 5).
enum {
    SOURCE_TYPE_NONE = 0,
    SOURCE_TYPE_RANDOM = 1,    // random selection
    SOURCE_TYPE_RADIO = 2,     // radio list
    SOURCE_TYPE_IPOD = 3,      // iPod track list
    SOURCE_TYPE_PLAYLIST = 4,  // saved playlist
    SOURCE_TYPE_CUSTOM = 6,    // custom slot
};



#endif
