// The play queue as clients see it: its JSON views (a page of it in
// player/playlist_page.h) and the queue actions of control requests. The
// queue itself (player/playlist.h) knows neither.
#ifndef TARN_PLAYLIST_ACTIONS_H
#define TARN_PLAYLIST_ACTIONS_H

#include <json/json.h>

#include "player/playlist.h"
#include "player/playlist_page.h"
#include "wire/tarn_wire.h"

// "title", "current", "artist" and "path" of the current entry into info;
// -1 (logged) when the current index names no entry.
int PlaylistCurrentInfoJson(const Playlist &playlist, Json::Value &info);

// Whether action is one of the queue's (ACT_QUEUE_*, ACT_SET_REPEAT_MODE,
// ACT_TOGGLE_SHUFFLE, ACT_CYCLE_REPEAT_MODE): the players hand these to
// PlaylistHandleAction.
bool PlaylistTakesAction(int action);

// Carries out one queue action; the list action answers in reply, a refused
// song of a full queue sets reply["error"]. -1 for a null request or an
// action that is not the queue's.
int PlaylistHandleAction(Playlist &playlist, const ControlRequest *request, Json::Value &reply);

// The reply of an ACT_QUEUE_LIST request, written straight from the queue:
// the text of PlaylistListJson's page cut to the reply by whole entries,
// NUL-terminated in out.
void PlaylistPageReply(const Playlist &playlist, const ControlRequest *request, char out[CTRL_REPLY_SIZE]);

#endif
