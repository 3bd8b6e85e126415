#include "LocalHttpServer.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <fstream>
#include <iterator>
#include <stdexcept>

namespace tavrix::test {
namespace {

constexpr std::size_t kMaxRequestHeadBytes = 64 * 1024;
constexpr int kSocketTimeoutSeconds = 5;

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
    if (a.size() != b.size()) {
        return false;
    }
    for (std::size_t i = 0; i < a.size(); ++i) {
        if (std::tolower(static_cast<unsigned char>(a[i])) !=
            std::tolower(static_cast<unsigned char>(b[i]))) {
            return false;
        }
    }
    return true;
}

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) {
        text.remove_prefix(1);
    }
    while (!text.empty() && (text.back() == ' ' || text.back() == '\t' || text.back() == '\r')) {
        text.remove_suffix(1);
    }
    return text;
}

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
        if (head.size() > kMaxRequestHeadBytes) {
            return std::nullopt;
        }
        ssize_t got = ::recv(fd, buffer, sizeof buffer, 0);
        if (got < 0 && errno == EINTR) {
            continue;
        }
        if (got <= 0) {
            return std::nullopt;
        }
        head.append(buffer, static_cast<std::size_t>(got));
    }
    return head.substr(0, head.find("\r\n\r\n"));
}

LocalHttpServer::Request parseRequest(std::string_view head) {
    LocalHttpServer::Request request;
    std::size_t lineEnd = head.find("\r\n");
    std::string_view requestLine = head.substr(0, lineEnd);
    std::size_t firstSpace = requestLine.find(' ');
    std::size_t lastSpace = requestLine.rfind(' ');
    if (firstSpace != std::string_view::npos && lastSpace > firstSpace) {
        request.method = requestLine.substr(0, firstSpace);
        request.target = requestLine.substr(firstSpace + 1, lastSpace - firstSpace - 1);
        request.version = requestLine.substr(lastSpace + 1);
    }
    while (lineEnd != std::string_view::npos) {
        std::size_t start = lineEnd + 2;
        lineEnd = head.find("\r\n", start);
        std::string_view line = head.substr(start, lineEnd - start);
        std::size_t colon = line.find(':');
        if (colon != std::string_view::npos) {
            request.headers.emplace_back(std::string(trimmed(line.substr(0, colon))),
                                         std::string(trimmed(line.substr(colon + 1))));
        }
    }
    return request;
}

LocalHttpServer::Response notFound() {
    LocalHttpServer::Response response;
    response.status = 404;
    response.reason = "Not Found";
    response.headers = {{"Content-Type", "text/html"}};
    response.body = "<html><body><h1>404 Not Found</h1></body></html>\n";
    return response;
}

std::string responseHead(const LocalHttpServer::Response& response) {
    std::string head = "HTTP/1.0 " + std::to_string(response.status) + " " + response.reason +
                       "\r\nConnection: close\r\n";
    bool hasLength = false;
    for (const auto& [name, value] : response.headers) {
        hasLength = hasLength || equalsIgnoringCase(name, "Content-Length");
        head += name + ": " + value + "\r\n";
    }
    if (!hasLength) {
        head += "Content-Length: " + std::to_string(response.body.size()) + "\r\n";
    }
    return head + "\r\n";
}

}  // namespace

std::optional<std::string> LocalHttpServer::Request::header(std::string_view name) const {
    for (const auto& [headerName, value] : headers) {
        if (equalsIgnoringCase(headerName, name)) {
            return value;
        }
    }
    return std::nullopt;
}

LocalHttpServer::LocalHttpServer() {
    listenFd_.reset(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!listenFd_) {
        throw std::runtime_error("socket failed");
    }
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = 0;
    socklen_t length = sizeof address;
    if (::bind(listenFd_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        ::listen(listenFd_.get(), 64) != 0 ||
        ::getsockname(listenFd_.get(), reinterpret_cast<sockaddr*>(&address), &length) != 0) {
        throw std::runtime_error("cannot listen on 127.0.0.1");
    }
    port_ = ntohs(address.sin_port);
    int pipeFds[2];
    if (::pipe2(pipeFds, O_CLOEXEC) != 0) {
        throw std::runtime_error("pipe failed");
    }
    wakeReadFd_.reset(pipeFds[0]);
    wakeWriteFd_.reset(pipeFds[1]);
    acceptThread_ = std::thread([this] { acceptLoop(); });
}

LocalHttpServer::~LocalHttpServer() {
    releaseHeldResponses();
    char wake = 1;
    (void)::write(wakeWriteFd_.get(), &wake, 1);
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

void LocalHttpServer::acceptLoop() {
    for (;;) {
        pollfd fds[2] = {{listenFd_.get(), POLLIN, 0}, {wakeReadFd_.get(), POLLIN, 0}};
        if (::poll(fds, 2, -1) < 0) {
            if (errno == EINTR) {
                continue;
            }
            return;
        }
        if (fds[1].revents != 0) {
            return;
        }
        int fd = ::accept4(listenFd_.get(), nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
            continue;
        }
        std::lock_guard lock(mutex_);
        connections_.emplace_back([this, fd] { handleConnection(fd); });
    }
}

void LocalHttpServer::handleConnection(int rawFd) {
    io::UniqueFd fd(rawFd);
    timeval timeout{kSocketTimeoutSeconds, 0};
    ::setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    ::setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &timeout, sizeof timeout);
    std::optional<std::string> head = readRequestHead(fd.get());
    if (!head) {
        return;
    }
    Request request = parseRequest(*head);
    {
        std::lock_guard lock(mutex_);
        requests_.push_back(request);
    }
    Response response = responseFor(request);
    std::string_view body = response.body;
    if (response.cutAfterBodyBytes) {
        body = body.substr(0, *response.cutAfterBodyBytes);
    }
    std::string_view held;
    if (response.holdAfterBodyBytes && *response.holdAfterBodyBytes < body.size()) {
        held = body.substr(*response.holdAfterBodyBytes);
        body = body.substr(0, *response.holdAfterBodyBytes);
    }
    if (response.trickleBytesPerSecond) {
        sendTrickling(fd.get(), responseHead(response), body, *response.trickleBytesPerSecond);
    } else if (sendAll(fd.get(), responseHead(response)) && sendAll(fd.get(), body) &&
               !held.empty()) {
        std::unique_lock lock(mutex_);
        ++heldResponses_;
        holdChanged_.notify_all();
        holdChanged_.wait(lock, [&] { return released_; });
        --heldResponses_;
        lock.unlock();
        sendAll(fd.get(), held);
    }
    ::shutdown(fd.get(), SHUT_WR);
}

void LocalHttpServer::sendTrickling(int fd, const std::string& head, std::string_view body,
                                    std::size_t bytesPerSecond) {
    if (!sendAll(fd, head)) {
        return;
    }
    while (!body.empty()) {
        std::size_t count = std::min(std::max<std::size_t>(bytesPerSecond, 1), body.size());
        if (!sendAll(fd, body.substr(0, count))) {
            return;
        }
        body.remove_prefix(count);
        // The server's end (which releases held responses) ends the trickle too.
        std::unique_lock lock(mutex_);
        if (holdChanged_.wait_for(lock, std::chrono::seconds(1), [&] { return released_; })) {
            return;
        }
    }
}

LocalHttpServer::Response LocalHttpServer::responseFor(const Request& request) const {
    std::lock_guard lock(mutex_);
    if (auto canned = responses_.find(request.target); canned != responses_.end()) {
        return canned->second;
    }
    for (const auto& [prefix, directory] : directories_) {
        if (!request.target.starts_with(prefix)) {
            continue;
        }
        std::string name = request.target.substr(prefix.size());
        if (name.empty() || name.find("..") != std::string::npos) {
            return notFound();
        }
        std::ifstream file(directory / name, std::ifstream::binary);
        if (!file) {
            return notFound();
        }
        Response response;
        response.body.assign(std::istreambuf_iterator<char>(file), {});
        return response;
    }
    return notFound();
}

}  // namespace tavrix::test
