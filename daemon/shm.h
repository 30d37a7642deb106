// System V shared-memory segments of the daemon's status.
#ifndef TARN_SHM_H
#define TARN_SHM_H

// Gets the segment `key` of `size` bytes (created with permissions 0666 when
// `create` is non-zero) and attaches it. Returns the address or null. An
// existing segment smaller than `size` fails.
void *ShmCreateAttach(int key, int size, int create);

// Detaches a segment; 0 or -1.
int ShmDetach(void *address);

// Removes the segment `key` from the system (for client tools; the daemon
// never removes its own). 0, or -1 when it does not exist or cannot be
// removed.
int ShmRemove(int key, int size);

#endif
