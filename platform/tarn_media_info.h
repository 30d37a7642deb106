// The song record of the media library, shared with the library's clients.
// Its layout is fixed byte for byte; the static_asserts below guard it.
#ifndef TARN_MEDIA_INFO_H
#define TARN_MEDIA_INFO_H

#include <cstddef>
#include <cstdint>

// ---------------------------------------------------------------------------
// Song record of the media library (7336 bytes, host byte order).
struct TARN_MEDIA_INFO {
    uint32_t id;                 // 0    song id
    char path[4096];             // 4    file path or URI
    int32_t track;               // 4100
    int32_t disc;                // 4104
    int32_t year;                // 4108
    char title[255];             // 4112
    char album[255];             // 4367
    char artist[510];            // 4622
    char genre[510];             // 5132
    char albumArtUrl[255];       // 5642
    char reserved1[339];         // 5897
    float duration;              // 6236 seconds
    uint32_t bitrate;            // 6240
    int32_t reserved2;           // 6244
    int32_t sample;              // 6248 sample rate
    int32_t channels;            // 6252
    char reserved3[8];           // 6256
    uint64_t size;               // 6264 bytes
    char reserved4[1064];        // 6272
};

static_assert(sizeof(TARN_MEDIA_INFO) == 7336, "TARN_MEDIA_INFO size");
static_assert(offsetof(TARN_MEDIA_INFO, path) == 4, "path");
static_assert(offsetof(TARN_MEDIA_INFO, track) == 4100, "track");
static_assert(offsetof(TARN_MEDIA_INFO, disc) == 4104, "disc");
static_assert(offsetof(TARN_MEDIA_INFO, year) == 4108, "year");
static_assert(offsetof(TARN_MEDIA_INFO, title) == 4112, "title");
static_assert(offsetof(TARN_MEDIA_INFO, album) == 4367, "album");
static_assert(offsetof(TARN_MEDIA_INFO, artist) == 4622, "artist");
static_assert(offsetof(TARN_MEDIA_INFO, genre) == 5132, "genre");
static_assert(offsetof(TARN_MEDIA_INFO, albumArtUrl) == 5642, "albumArtUrl");
static_assert(offsetof(TARN_MEDIA_INFO, duration) == 6236, "duration");
static_assert(offsetof(TARN_MEDIA_INFO, bitrate) == 6240, "bitrate");
static_assert(offsetof(TARN_MEDIA_INFO, sample) == 6248, "sample");
static_assert(offsetof(TARN_MEDIA_INFO, channels) == 6252, "channels");
static_assert(offsetof(TARN_MEDIA_INFO, size) == 6264, "size");

#endif
