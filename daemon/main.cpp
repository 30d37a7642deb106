// tarnaudiod: the audio playback daemon.
//   tarnaudiod [--foreground]     start (detached unless --foreground)
//   tarnaudiod --help | --version
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "daemon/preflight.h"
#include "daemon/tarnaudiod.h"
#include "platform/tarn_version.h"

static void Usage(FILE *out)
{
    fprintf(out,
            "usage: tarnaudiod [--foreground]\n"
            "       tarnaudiod --help | --version\n"
            "  -f, --foreground  stay attached and log to standard error as well as syslog\n"
            "  -h, --help        show this text\n"
            "  -V, --version     show the version\n"
            "Clients talk to the control socket /tmp/tarnaudiod.sock (tarnctl); settings are\n"
            "read from /etc/tarninfo.conf. See tarnaudiod(8).\n");
}

int main(int argc, char **argv)
{
    bool foreground = false;
    for (int i = 1; i < argc; ++i) {
        const char *a = argv[i];
        if (!strcmp(a, "-h") || !strcmp(a, "--help")) {
            Usage(stdout);
            return 0;
        }
        if (!strcmp(a, "-V") || !strcmp(a, "--version")) {
            printf("tarnaudiod %s\n", TARN_VERSION);
            return 0;
        }
        if (!strcmp(a, "-f") || !strcmp(a, "--foreground")) {
            foreground = true;
            continue;
        }
        fprintf(stderr, "tarnaudiod: unknown argument '%s'\n", a);
        Usage(stderr);
        return 2;
    }
    std::vector<std::string> problems;
    if (DaemonPreflight(&problems) != 0) {
        for (const std::string &p : problems)
            fprintf(stderr, "tarnaudiod: %s\n", p.c_str());
        fprintf(stderr, "tarnaudiod: not started\n");
        return 1;
    }
    std::vector<std::string> warnings;
    DaemonPreflightWarnings(&warnings);
    for (const std::string &w : warnings)
        fprintf(stderr, "tarnaudiod: warning: %s\n", w.c_str());
    DaemonSetForeground(foreground);
    return DaemonRun();
}
