// Who may talk to the daemon: the control socket and the two status
// segments belong to one group ("audio_group" of the configuration, default
// "audio"); members may connect and read the status, others may not.
#ifndef TARN_ACCESS_H
#define TARN_ACCESS_H

#include <sys/types.h>

// Mode of the control socket and of the status segments.
#define ACCESS_SOCKET_MODE 0660
#define ACCESS_SEGMENT_MODE 0640
// umask values under which the sockets are created: the control socket
// 0660, the mplayer socket 0600 (only the daemon's own user).
#define ACCESS_CTRL_UMASK 0117
#define ACCESS_MPLAYER_UMASK 0177

// The group's id, read from the configuration each call; (gid_t)-1 when the
// group does not exist (logged; socket and segments then keep the daemon's
// own group).
gid_t AccessGroup();

// Gives the socket at path to the group with ACCESS_SOCKET_MODE. 0 or -1
// (logged).
int AccessShareSocket(const char *path, gid_t group);

// Gives the segment at the address to the group with ACCESS_SEGMENT_MODE.
// 0 or -1 (logged).
int AccessShareSegment(const void *address, int key, gid_t group);

#endif
