// A small HTTP server on 127.0.0.1 for tests that need a real peer: canned responses per path
// with chosen headers, files served from a directory, the requests it received, and connections
// cut or held in the middle of a body. Each connection is answered once and closed (HTTP/1.0
// style).
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "io/UniqueFd.h"

namespace tavrix::test {

class LocalHttpServer {
  public:
    struct Response {
        int status = 200;
        std::string reason = "OK";
        // Sent in order, after "Content-Length".
        std::vector<std::pair<std::string, std::string>> headers;
        std::string body;
        // When set, only this many body bytes are sent (after the full Content-Length was
        // announced) before the connection is closed.
        std::optional<std::size_t> cutAfterBodyBytes;
        // When set, only this many body bytes are sent until releaseHeldResponses() (or the
        // server's end); then the rest follows. For work that must stay pending a while.
        std::optional<std::size_t> holdAfterBodyBytes;
        // When set, the body goes out this many bytes a second, until it is sent or the server
        // ends: a peer that is alive but too slow to wait for.
        std::optional<std::size_t> trickleBytesPerSecond;
    };

    struct Request {
        std::string method;
        std::string target;
    };

    // Listens on 127.0.0.1 at a port the kernel chooses; throws std::runtime_error when it cannot.
    LocalHttpServer();
    // Stops listening and waits for the connections in progress.
    ~LocalHttpServer();
    LocalHttpServer(const LocalHttpServer&) = delete;
    LocalHttpServer& operator=(const LocalHttpServer&) = delete;

    std::uint16_t port() const { return port_; }
    // "http://127.0.0.1:<port>" + path.
    std::string url(std::string_view path) const;

    // Answers requests for exactly this path (query included) with response.
    void serve(const std::string& path, Response response);
    // Answers requests for this path as before serve() was called for it.
    void stopServing(const std::string& path);
    // Answers requests for urlPrefix + name with the file directory/name (200, or 404 when it
    // cannot be read; names holding ".." are refused).
    void serveDirectory(const std::string& urlPrefix, const std::filesystem::path& directory);
    // Every request received so far, in arrival order.
    std::vector<Request> requests() const;

    // Waits until a response is being held: true, or false at the timeout.
    bool waitForHeldResponse(std::chrono::milliseconds timeout);
    // Lets every held response finish; responses asked for later are not held.
    void releaseHeldResponses();
    // Holds the responses asked for from now on again, as before the first release.
    void holdAgain();

  private:
    void acceptLoop();
    void handleConnection(int fd);
    // Records the request and chooses its answer.
    Response responseFor(const Request& request);

    io::UniqueFd listenFd_;
    std::uint16_t port_ = 0;
    mutable std::mutex mutex_;
    std::map<std::string, Response> responses_;
    std::vector<std::pair<std::string, std::filesystem::path>> directories_;
    std::vector<Request> requests_;
    std::condition_variable holdChanged_;
    int heldResponses_ = 0;
    bool released_ = false;
    std::vector<std::thread> connections_;
    std::thread acceptThread_;
};

}  // namespace tavrix::test
