#include "LocalHttpServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/time.h>

#include <algorithm>
#include <cerrno>
#include <fstream>
#include <iterator>
#include <sstream>
#include <stdexcept>

namespace tavrix::test {
namespace {

bool sendAll(int fd, std::string_view bytes) {
    while (!bytes.empty()) {
        ssize_t sent = ::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL);
        if (sent < 0 && errno == EINTR) {
            continue;
        }
        if (sent <= 0) {
            return false;
        }
        bytes.remove_prefix(static_cast<std::size_t>(sent));
    }
    return true;
}

// The request head (up to the blank line), or nothing when the peer stops first.
std::optional<std::string> readRequestHead(int fd) {
    std::string head;
    char buffer[4096];
    while (head.find("\r\n\r\n") == std::string::npos) {
        ssize_t got = ::recv(fd, buffer, sizeof buffer, 0);
        if (got < 0 && errno == EINTR) {
            continue;
        }
        if (got <= 0 || head.size() > 64 * 1024) {
            return std::nullopt;
        }
        head.append(buffer, static_cast<std::size_t>(got));
    }
    return head.substr(0, head.find("\r\n\r\n"));
}

}  // namespace

LocalHttpServer::LocalHttpServer() {
    listenFd_.reset(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    if (!listenFd_ ||
        ::bind(listenFd_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        ::listen(listenFd_.get(), 64) != 0 ||
        ::getsockname(listenFd_.get(), reinterpret_cast<sockaddr*>(&address), &length) != 0) {
        throw std::runtime_error("cannot listen on 127.0.0.1");
    }
    port_ = ntohs(address.sin_port);
    acceptThread_ = std::thread([this] { acceptLoop(); });
}

LocalHttpServer::~LocalHttpServer() {
    releaseHeldResponses();
    // Wakes the accept loop: accept fails on a listening socket that was shut down.
    ::shutdown(listenFd_.get(), SHUT_RDWR);
    acceptThread_.join();
    std::vector<std::thread> connections;
    {
        std::lock_guard lock(mutex_);
        connections.swap(connections_);
    }
    for (std::thread& connection : connections) {
        connection.join();
    }
}

std::string LocalHttpServer::url(std::string_view path) const {
    return "http://127.0.0.1:" + std::to_string(port_) + std::string(path);
}

void LocalHttpServer::serve(const std::string& path, Response response) {
    std::lock_guard lock(mutex_);
    responses_.insert_or_assign(path, std::move(response));
}

void LocalHttpServer::stopServing(const std::string& path) {
    std::lock_guard lock(mutex_);
    responses_.erase(path);
}

void LocalHttpServer::serveDirectory(const std::string& urlPrefix,
                                     const std::filesystem::path& directory) {
    std::lock_guard lock(mutex_);
    directories_.emplace_back(urlPrefix, directory);
}

std::vector<LocalHttpServer::Request> LocalHttpServer::requests() const {
    std::lock_guard lock(mutex_);
    return requests_;
}

bool LocalHttpServer::waitForHeldResponse(std::chrono::milliseconds timeout) {
    std::unique_lock lock(mutex_);
    return holdChanged_.wait_for(lock, timeout, [&] { return heldResponses_ > 0; });
}

void LocalHttpServer::releaseHeldResponses() {
    std::lock_guard lock(mutex_);
    released_ = true;
    holdChanged_.notify_all();
}

void LocalHttpServer::holdAgain() {
    std::lock_guard lock(mutex_);
    released_ = false;
}

void LocalHttpServer::acceptLoop() {
    for (;;) {
        int fd = ::accept4(listenFd_.get(), nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0 && errno != EINTR && errno != ECONNABORTED) {
            return;
        }
        if (fd >= 0) {
            std::lock_guard lock(mutex_);
            connections_.emplace_back([this, fd] { handleConnection(fd); });
        }
    }
}

void LocalHttpServer::handleConnection(int rawFd) {
    io::UniqueFd fd(rawFd);
    timeval timeout{5, 0};
    ::setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    ::setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &timeout, sizeof timeout);
    std::optional<std::string> head = readRequestHead(fd.get());
    if (!head) {
        return;
    }
    Request request;
    std::istringstream(*head) >> request.method >> request.target;
    const Response response = responseFor(request);
    std::string_view body = response.body;
    body = body.substr(0, response.cutAfterBodyBytes.value_or(body.size()));
    const std::size_t holdAt =
        std::min(response.holdAfterBodyBytes.value_or(body.size()), body.size());
    std::string answer =
        "HTTP/1.0 " + std::to_string(response.status) + " " + response.reason +
        "\r\nConnection: close\r\nContent-Length: " + std::to_string(response.body.size()) + "\r\n";
    for (const auto& [name, value] : response.headers) {
        answer += name + ": " + value + "\r\n";
    }
    if (!sendAll(fd.get(), answer + "\r\n")) {
        return;
    }
    if (response.trickleBytesPerSecond) {
        const std::size_t step = std::max<std::size_t>(*response.trickleBytesPerSecond, 1);
        for (std::size_t at = 0; at < body.size(); at += step) {
            // The server's end (which releases held responses) ends the trickle too.
            std::unique_lock lock(mutex_);
            if (at > 0 &&
                holdChanged_.wait_for(lock, std::chrono::seconds(1), [&] { return released_; })) {
                return;
            }
            lock.unlock();
            if (!sendAll(fd.get(), body.substr(at, step))) {
                return;
            }
        }
    } else if (sendAll(fd.get(), body.substr(0, holdAt)) && holdAt < body.size()) {
        std::unique_lock lock(mutex_);
        ++heldResponses_;
        holdChanged_.notify_all();
        holdChanged_.wait(lock, [&] { return released_; });
        --heldResponses_;
        lock.unlock();
        sendAll(fd.get(), body.substr(holdAt));
    }
    ::shutdown(fd.get(), SHUT_WR);
}

LocalHttpServer::Response LocalHttpServer::responseFor(const Request& request) {
    std::lock_guard lock(mutex_);
    requests_.push_back(request);
    if (auto canned = responses_.find(request.target); canned != responses_.end()) {
        return canned->second;
    }
    for (const auto& [prefix, directory] : directories_) {
        if (!request.target.starts_with(prefix)) {
            continue;
        }
        std::string name = request.target.substr(prefix.size());
        std::ifstream file(directory / name, std::ifstream::binary);
        if (!name.empty() && name.find("..") == std::string::npos && file) {
            Response response;
            response.body.assign(std::istreambuf_iterator<char>(file), {});
            return response;
        }
    }
    Response notFound;
    notFound.status = 404;
    notFound.reason = "Not Found";
    notFound.body = "<html><body><h1>404 Not Found</h1></body></html>\n";
    return notFound;
}

}  // namespace tavrix::test
