// tarnaudiod: the audio playback daemon. Arguments are ignored.
#include "daemon/tarnaudiod.h"

int main()
{
    return DaemonRun();
}
