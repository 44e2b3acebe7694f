// A web server on loopback for one request.
#pragma once

#include <string>
#include <thread>

#include "loopback.h"

// Reads to the end of the request's headers and answers; the connection stays open until the next one or the end.
class WebServer {
public:
    explicit WebServer(std::string szAnswer, const char* szAddress = "127.0.0.1")
        : mSzAnswer(std::move(szAnswer)), mFd(SocketAt(szAddress, 0, SOCK_STREAM)) {
        EXPECT_EQ(listen(mFd.Get(), 1), 0);
        mThread = std::thread([this] { Serve(); });
    }
    ~WebServer() { Request(); }
    WebServer(const WebServer&) = delete;
    WebServer& operator=(const WebServer&) = delete;

    int Port() const { return PortOf(mFd); }
    // What it was asked; waits for that.
    std::string Request() {
        if (mThread.joinable()) {
            mThread.join();
        }
        return mSzRequest;
    }

private:
    void Serve() {
        mFdClient.Reset(accept(mFd.Get(), nullptr, nullptr));
        char szText[1000];
        while (mSzRequest.find("\r\n\r\n") == std::string::npos) {
            const ssize_t nRead = recv(mFdClient.Get(), szText, sizeof(szText), 0);
            if (nRead <= 0) {
                return;
            }
            mSzRequest.append(szText, static_cast<size_t>(nRead));
        }
        send(mFdClient.Get(), mSzAnswer.data(), mSzAnswer.size(), MSG_NOSIGNAL);
    }

    std::string mSzAnswer;
    std::string mSzRequest;
    tavo::Descriptor mFd;
    tavo::Descriptor mFdClient;
    std::thread mThread;
};
