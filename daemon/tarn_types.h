// Everything the daemon and its tools share with other processes: the fixed
// paths, the song record and the wire formats.
#ifndef TARN_TYPES_H
#define TARN_TYPES_H

#include "platform/tarn_env.h"
#include "platform/tarn_media_info.h"
#include "wire/tarn_wire.h"

#endif
