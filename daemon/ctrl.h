// Client side of the control protocol: one ControlRequest per connection to
// the daemon's control socket, one 8192-byte JSON reply back. Every call
// returns 0 or -1; failures are logged. The calls keep no state and may be
// used from any number of processes at once.
#ifndef TARN_CTRL_H
#define TARN_CTRL_H

#include <string>

#include "daemon/tarn_types.h"

// A descriptor connected to the control socket, or a negative value.
int CtrlConnect();

// A descriptor connected to the control socket at path (a daemon under
// another root), or a negative value with *error (when given) set to the
// errno of the failed step: -1 no socket could be made, -2 the connect
// failed. Logs nothing: the caller tells. With nonBlocking a full backlog
// fails at once with EAGAIN instead of waiting; the descriptor returned is
// blocking either way.
int CtrlConnectAt(const char *path, bool nonBlocking, int *error);

// Sends the 8196-byte request in one write and reads the first chunk of the
// reply (waiting at most 0.5 s) into reply[0..replySize). 0 or -1.
int CtrlSendRequest(const ControlRequest *request, char *reply, int replySize);

// CtrlConnect and CtrlSendRequest for clients that tell people why a request
// failed: the wait for the reply is timeoutMs, and *error (when given) gets
// 0 or the errno of the step that failed: ENOENT or ECONNREFUSED (the
// daemon is not running), EACCES or EPERM (not allowed to use the socket),
// ETIMEDOUT (no reply in time), EPIPE (the daemon closed the connection
// without a reply) or another socket error.
int CtrlConnectWhy(int *error);
int CtrlSendRequestTimed(const ControlRequest *request, char *reply, int replySize, int timeoutMs,
                         int *error);

// Player actions (the reply is read and dropped).
int CtrlPlayPause();
int CtrlStop();
int CtrlNext();
int CtrlPrevious();
int CtrlPlayIndex(int index);
int CtrlSeek(int position);
int CtrlMute();
int CtrlSetVolume(int volume);
int CtrlVolumeUp();
int CtrlVolumeDown();

// Sources.
int CtrlSourceRandom();
int CtrlSourceRadio();
int CtrlSourceIpod();
int CtrlSourcePlaylist();
int CtrlSourceCustom(int slot);
int CtrlSaveCustom(int slot);
int CtrlSourceNext();
int CtrlSourcePrevious();

// Changed flag of the published status.
int CtrlClearChanged();
int CtrlSetChanged();

// Ten equalizer gains, sent as "%3.1f" texts separated by one blank.
int CtrlSetEqualizer(const float gains[10]);

// Builds the text CtrlSetEqualizer sends ("0.0 0.0 ..."); returns its length.
int CtrlFormatEqualizer(const float gains[10], char *text, int size);

// UPnP discovery and player selection.
int InfoSearchServers();
int InfoSearchRenderers();
int InfoListServers(int start, int limit, char *reply, int replySize);
int InfoListRenderers(int start, int limit, char *reply, int replySize);
int InfoSelectPlayer(int index);  // -1: the local player

// Status and queue pages into the caller's buffer.
int InfoGetStatus(char *reply, int replySize);
int InfoListQueue(int start, int limit, char *reply, int replySize);

#endif
