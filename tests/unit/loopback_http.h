// An HTTP server on 127.0.0.1 for unit tests, serving in its own thread
// until the object goes.
#ifndef TARN_TEST_LOOPBACK_HTTP_H
#define TARN_TEST_LOOPBACK_HTTP_H

#include <chrono>
#include <string>
#include <thread>

#include <httplib.h>

struct LoopbackHttp {
    httplib::Server server;
    std::thread thread;

    // Binds a free port and serves the routes set so far: the base URL
    // ("http://127.0.0.1:PORT"), or "" when it could not.
    std::string Start()
    {
        int port = server.bind_to_any_port("127.0.0.1");
        if (port <= 0)
            return "";
        thread = std::thread([this] { server.listen_after_bind(); });
        for (int i = 0; i < 200 && !server.is_running(); i++)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        return server.is_running() ? "http://127.0.0.1:" + std::to_string(port) : "";
    }
    // Ends serving (before the routes' captures go).
    void Stop()
    {
        server.stop();
        if (thread.joinable())
            thread.join();
    }
    ~LoopbackHttp() { Stop(); }
};

#endif
