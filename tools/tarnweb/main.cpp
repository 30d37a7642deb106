// tarnweb: the appliance's web server. It serves the songs that the daemon
// hands to UPnP renderers and the web remote (the page people play music
// from, its JSON API and live status).
//
//   tarnweb [--port N] [--bind ADDR] [--threads N] [--max-per-client N] [--db FILE]
//           [--write-timeout SEC] [--access-log FILE]
//           [--www DIR] [--no-remote] [--verbose]
//
// The port defaults to "admin_port" of /etc/tarninfo.conf, the port the
// daemon writes into its song URLs; the address to "web_bind" there, else
// 0.0.0.0. "--port 0" takes any free port. Once listening it prints
// "tarnweb: listening on ADDR:PORT" and, with the remote, the page's URL.
// SIGTERM or SIGINT stop it.
#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <thread>

#include "daemon/tarn_types.h"
#include "platform/medialib.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"
#include "platform/tarn_version.h"
#include "tools/tarnweb/song_server.h"
#include "tools/tarnweb/web_remote.h"

namespace {

void Usage(FILE *out)
{
    fprintf(out,
            "usage: tarnweb [--port N] [--bind ADDR] [--threads N] [--db FILE]\n"
            "               [--max-per-client N] [--write-timeout SEC] [--access-log FILE]\n"
            "               [--www DIR] [--no-remote] [--verbose]\n"
            "  --port N          port to listen on (default: admin_port of %s; 0: any)\n"
            "  --bind ADDR       address to listen on (default: web_bind of the\n"
            "                    configuration, or 0.0.0.0)\n"
            "  --threads N       requests served at once (default 64)\n"
            "  --max-per-client N connections of one client address at once (default 16)\n"
            "  --db FILE         media library database (default %s)\n"
            "  --write-timeout S drop a client that takes nothing for S seconds (default 60)\n"
            "  --access-log FILE append one line per song request to FILE\n"
            "  --www DIR         the web remote's files (default: web_root of the\n"
            "                    configuration, or ../share/tarnweb/www beside the program)\n"
            "  --no-remote       serve songs only, no web remote\n"
            "  --verbose         one line per request on standard error\n",
            TarnPath(TARN_INFO_CONF).c_str(), "/usr/tarn/var/medialib.db");
}

bool ParseInt(const char *text, int low, int high, int *out)
{
    char *end = nullptr;
    long v = strtol(text, &end, 10);
    if (!*text || *end || v < low || v > high)
        return false;
    *out = static_cast<int>(v);
    return true;
}

// What the command line asked for.
struct WebArgs {
    SongServerOptions options;
    WebRemoteOptions remoteOptions;
    bool portGiven = false;
    bool bindGiven = false;
    bool remoteOn = true;
};

// The options into args; -1 to go on, else the exit status (help, version
// or a bad option, already printed).
int ParseArgs(int argc, char **argv, WebArgs *args)
{
    SongServerOptions &options = args->options;
    for (int i = 1; i < argc; ++i) {
        std::string a = argv[i];
        const char *value = i + 1 < argc ? argv[i + 1] : nullptr;
        bool ok = true;
        if (a == "--help" || a == "-h") {
            Usage(stdout);
            return 0;
        } else if (a == "--version") {
            printf("tarnweb %s\n", TARN_VERSION);
            return 0;
        } else if (a == "--verbose") {
            options.verbose = true;
            continue;
        } else if (a == "--no-remote") {
            args->remoteOn = false;
            continue;
        } else if (!value) {
            fprintf(stderr, "tarnweb: %s needs a value (see --help)\n", a.c_str());
            return 2;
        } else if (a == "--port") {
            ok = ParseInt(value, 0, 65535, &options.port);
            args->portGiven = ok;
        } else if (a == "--bind") {
            options.bindAddress = value;
            args->bindGiven = true;
        } else if (a == "--www") {
            args->remoteOptions.wwwDir = value;
        } else if (a == "--threads") {
            ok = ParseInt(value, 1, 256, &options.threads);
        } else if (a == "--max-per-client") {
            ok = ParseInt(value, 1, 4096, &options.perClient);
        } else if (a == "--write-timeout") {
            ok = ParseInt(value, 1, 3600, &options.writeTimeoutSec);
        } else if (a == "--db") {
            options.dbPath = value;
        } else if (a == "--access-log") {
            options.accessLog = value;
        } else {
            fprintf(stderr, "tarnweb: unknown option %s (see --help)\n", a.c_str());
            return 2;
        }
        if (!ok) {
            fprintf(stderr, "tarnweb: bad value [%s] for %s\n", value, a.c_str());
            return 2;
        }
        ++i;
    }
    return -1;
}

// Address and port not given take the configuration's; 0, or -1 (printed)
// when there is no port at all.
int ApplyConfiguration(WebArgs *args)
{
    SongServerOptions &options = args->options;
    std::string conf = TarnPath(TARN_INFO_CONF);
    if (!args->bindGiven) {
        char bind[64] = "";
        if (TLIBCFileGetKeyValue(conf.c_str(), "web_bind", bind, sizeof(bind), 0) > 0)
            options.bindAddress = bind;
    }
    if (!args->portGiven) {
        char port[16] = "";
        if (TLIBCFileGetKeyValue(conf.c_str(), "admin_port", port, sizeof(port), 0) <= 0 ||
            !ParseInt(port, 1, 65535, &options.port)) {
            fprintf(stderr, "tarnweb: no port: set admin_port in %s or pass --port\n", conf.c_str());
            return -1;
        }
    }
    return 0;
}

// The web remote, or none (said on standard error and in the log) when it
// cannot start; songs are served either way.
std::unique_ptr<WebRemote> StartRemote(WebArgs *args)
{
    SongServerOptions &options = args->options;
    WebRemoteOptions &remoteOptions = args->remoteOptions;
    std::unique_ptr<WebRemote> remote;
    // Live status streams hold a worker each: they get threads of their own.
    options.threads += remoteOptions.maxStreams;
    if (!options.dbPath.empty())
        MediaLibSetDefaultPath(options.dbPath);  // the playlist functions read it too
    remoteOptions.dbPath = options.dbPath;
    remote.reset(new WebRemote(remoteOptions));
    std::string why;
    if (remote->Init(&why) != 0) {
        fprintf(stderr, "tarnweb: no web remote: %s (songs are served; --no-remote hides this)\n",
                why.c_str());
        TarnLog("%s:%d No web remote: %s", "tarnweb", __LINE__, why.c_str());
        remote.reset();
    }
    return remote;
}

// The lines that tell where the server listens.
void PrintListening(const SongServerOptions &options, int port, bool remote)
{
    printf("tarnweb: listening on %s:%d\n", options.bindAddress.c_str(), port);
    if (remote) {
        std::string host = options.bindAddress == "0.0.0.0" || options.bindAddress == "::"
                               ? "127.0.0.1" : options.bindAddress;
        if (host.find(':') != std::string::npos)
            host = "[" + host + "]";
        printf("tarnweb: web remote at http://%s:%d/\n", host.c_str(), port);
    }
    fflush(stdout);
}

// Serves until one of stopSignals arrives (taken by a thread of its own);
// the exit status.
int ServeUntilStopped(SongServer &server, WebRemote *remoteP, sigset_t stopSignals)
{
    std::atomic<bool> served(false);
    std::thread waiter([&server, &served, stopSignals, remoteP] {
        int sig = 0;
        sigwait(&stopSignals, &sig);
        // Live status streams end first, so the workers can finish.
        if (remoteP)
            remoteP->Stop();
        // Repeated: a signal that comes before the server loop has started
        // would otherwise be lost.
        while (!served.load()) {
            server.Stop();
            usleep(50 * 1000);
        }
    });
    int r = server.Serve();
    served.store(true);
    if (r != 0) {
        fprintf(stderr, "tarnweb: listening failed\n");
        // Wake the signal thread so that it can be joined.
        kill(getpid(), SIGTERM);
    }
    waiter.join();
    return r == 0 ? 0 : 1;
}

}  // namespace

int main(int argc, char **argv)
{
    TarnLogOpen("tarnweb");
    WebArgs args;
    int status = ParseArgs(argc, argv, &args);
    if (status >= 0)
        return status;
    if (ApplyConfiguration(&args) != 0)
        return 2;
    SongServerOptions &options = args.options;

    // Signals are taken by one thread; the server threads never see them.
    sigset_t stopSignals;
    sigemptyset(&stopSignals);
    sigaddset(&stopSignals, SIGTERM);
    sigaddset(&stopSignals, SIGINT);
    pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
    signal(SIGPIPE, SIG_IGN);

    std::unique_ptr<WebRemote> remote;
    if (args.remoteOn)
        remote = StartRemote(&args);
    SongServer server(options);
    if (remote)
        remote->Register(server.Http());
    int port = server.Bind();
    if (port <= 0) {
        fprintf(stderr, "tarnweb: cannot listen on %s:%d (in use, or not an address of this machine)\n",
                options.bindAddress.c_str(), options.port);
        TarnLog("%s:%d Cannot listen on %s:%d", "tarnweb", __LINE__, options.bindAddress.c_str(),
                options.port);
        return 1;
    }
    PrintListening(options, port, remote != nullptr);
    return ServeUntilStopped(server, remote.get(), stopSignals);
}
