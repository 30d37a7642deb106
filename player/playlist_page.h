// One page of the play queue as clients see it: as a JSON value, or as the
// text of a control reply written straight from the queue (a page is the
// reply clients ask for most, and building the value first costs several
// times writing the text).
#ifndef TARN_PLAYLIST_PAGE_H
#define TARN_PLAYLIST_PAGE_H

#include <json/json.h>

#include <cstddef>
#include <string>

#include "player/playlist.h"

// The title shown for an entry: its title, else the file name of its path,
// else the whole path.
std::string PlaylistDisplayTitle(const QueueEntry *entry);

// One page of the queue into reply: "uris" (at most 64 entries from start;
// limit 0 or above 64 means 64, a negative limit 20), "total", "current",
// "mode", "shuffle" and "order_index".
int PlaylistListJson(const Playlist &playlist, int start, int limit, Json::Value &reply);

// The same page as text (platform/json_text.h's layout, ending with a line
// feed), keeping as many whole entries from the page's start as let the
// text stay within most characters; the text is that of the page's JSON
// value with those entries.
int PlaylistPageText(const Playlist &playlist, int start, int limit, size_t most, std::string *text);

#endif
