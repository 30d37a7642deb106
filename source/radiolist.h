// Internet radio station lists, kept as JSON files in the radio directory.
//
// List file layout (one JSON object, written with Json::StyledWriter):
//   "stations": array of {"name", "url", "desc", "bitrate", ...}
//   "total":    number of stations, as last written
// "bitrate" is kilobits per second as text in the files and bits per second
// (an integer) in the trees handed out by the readers.
//
// Lists: user-defined (type 1) and favourite (type 2), edited here; the
// RadioIO list and one SHOUTcast list per genre, fetched by the platform's
// updaters when their file is missing or a day old.
#ifndef TARN_RADIOLIST_H
#define TARN_RADIOLIST_H

#include <string>

#include <json/json.h>

#define TARN_RADIO_DIR "/usr/tarn/etc/audio/radio"
#define TARN_RADIO_USERDEF TARN_RADIO_DIR "/userdef.json"
#define TARN_RADIO_FAVORITE TARN_RADIO_DIR "/favorite.json"
#define TARN_RADIO_RADIOIO TARN_RADIO_DIR "/radioio.json"

enum {
    RADIO_LIST_USERDEF = 1,
    RADIO_LIST_FAVORITE = 2,
};

#define SHOUTCAST_GENRE_COUNT 26

struct ShoutcastGenre {
    const char *display;  // shown to users; names the list file
    const char *query;    // the genre as written in a directory query
};
extern const ShoutcastGenre SHOUTCAST_GENRES[SHOUTCAST_GENRE_COUNT];

int RadioListPath(int type, std::string &path);
int RadioioJsonPath(std::string &path);
int ShoutcastJsonPath(int index, std::string &path);
int ShoutcastGenreIndex(const char *genre);
int ShoutcastGenreList(Json::Value &array);

// 1 when the list at path must be fetched again (missing, unreadable or at
// least a day old), 0 when it is fresh.
int RadioListIsStale(const char *path);
void NormalizeBitrates(Json::Value &list);

// Limits on a radio list file read from disk (configuration keys
// "radio_list_max_bytes" and "radio_list_max_stations"): a larger list is
// refused like a damaged one, with a log line.
#define RADIO_LIST_DEFAULT_MAX_BYTES (4UL * 1024 * 1024)
#define RADIO_LIST_DEFAULT_MAX_STATIONS 5000
size_t RadioListMaxBytes();
unsigned RadioListMaxStations();

int RadioListGet(int type, Json::Value &list);
int RadioioListGet(Json::Value &list, bool force);
int ShoutcastListGet(int index, Json::Value &list, bool force);
int ShoutcastListGetByGenre(const char *genre, Json::Value &list, bool force);

// Writes the list to path. The text goes to a temporary file beside path
// which then replaces it, so a failed write leaves the old file intact.
int RadioListSave(const char *path, const Json::Value &list);
// The edits answer as they always have (a list that could not be written
// still counts as edited, with a log line naming the file); saved, when
// given, tells whether the list on disk now holds the edit.
int RadioListAdd(int type, const Json::Value &stations, bool *saved = nullptr);
int RadioListEdit(int type, unsigned index, const Json::Value &station, bool *saved = nullptr);
int RadioListDelete(int type, const std::string &selection, bool *saved = nullptr);

#endif
