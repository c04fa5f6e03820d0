// Windows Sockets 2 for socket_system.h.
//
// Waking a blocked call: shutdown() alone wakes no thread blocked in recv,
// send or WSAPoll on the socket; CancelIoEx on the socket's handle after it
// does (the call fails with 995, and later receives with WSAESHUTDOWN). A
// WSAPoll that starts after the shutdown reports nothing until it times out,
// hence kPollSliceMs and the callers' own shut-down flags.
#include <winsock2.h>
#include <ws2tcpip.h>
// winsock2.h before windows.h
#include <windows.h>

#include <cerrno>
#include <chrono>
#include <thread>
#include <vector>

#include "pm/ip/socket_system.h"
#include "pm/runtime/log.h"

namespace pm::ip {
namespace {
constexpr int kOperationAborted = 995;  // ERROR_OPERATION_ABORTED: a call ended by CancelIoEx
}  // namespace

LastSocketError LastSocketError::Read() { return LastSocketError{errno, ::WSAGetLastError()}; }

void LastSocketError::Restore() const {
  errno = err;
  ::WSASetLastError(wsa);
}

bool LastSocketError::AlreadyConnected() const { return err == EISCONN || wsa == WSAEISCONN; }

bool LastSocketError::Interrupted() const { return err == EINTR || wsa == WSAEINTR; }

bool LastSocketError::Gone() const {
  return wsa == WSAENOTSOCK || wsa == WSAECONNRESET || wsa == WSAESHUTDOWN || wsa == kOperationAborted;
}

bool LastSocketError::TimedOut() const { return wsa == WSAECONNABORTED || wsa == WSAETIMEDOUT; }

bool LastSocketError::WouldBlock() const { return wsa == WSAEWOULDBLOCK; }

bool LastSocketError::InProgress() const { return wsa == WSAEWOULDBLOCK || wsa == WSAEALREADY || wsa == WSAEINPROGRESS; }

namespace sys {
namespace {

constexpr SHORT kPollAskRead = POLLRDNORM | POLLRDBAND;
constexpr SHORT kPollReady = POLLRDNORM | POLLRDBAND | POLLWRNORM | POLLERR | POLLHUP | POLLNVAL;

sockaddr_in LoopbackAddress(int port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = ::htons(static_cast<u_short>(port));
  address.sin_addr.s_addr = ::htonl(INADDR_LOOPBACK);
  return address;
}

SOCKET S(SocketHandle handle) { return static_cast<SOCKET>(handle); }

bool SetTimeout(SocketHandle handle, int option, std::uint32_t ms) {
  const DWORD value = ms;
  return ::setsockopt(S(handle), SOL_SOCKET, option, reinterpret_cast<const char*>(&value), sizeof(value)) == 0;
}

SocketHandle Handle(SOCKET socket) { return socket == INVALID_SOCKET ? kNoSocket : static_cast<SocketHandle>(socket); }

// Sockets are made without inheritance: a child process (the runner, a
// sender) must not hold our connections open.
void NotInherited(SOCKET socket) { ::SetHandleInformation(reinterpret_cast<HANDLE>(socket), HANDLE_FLAG_INHERIT, 0); }

}  // namespace

const int kPollSliceMs = 100;

bool StartOnce() {
  static const int result = [] {
    WSADATA data{};
    return ::WSAStartup(MAKEWORD(2, 2), &data);
  }();
  if (result != 0) {
    static bool logged = [] {
      Log(LogType::Normal, "", "WSAStartup failed %d\n", result);
      return true;
    }();
    (void)logged;
  }
  return result == 0;
}

SocketHandle OpenTcp(bool nonBlocking) {
  // Overlapped, as socket() makes them: SO_RCVTIMEO works only on such.
  const SOCKET socket = ::WSASocketW(AF_INET, SOCK_STREAM, IPPROTO_TCP, nullptr, 0, WSA_FLAG_OVERLAPPED);
  if (socket == INVALID_SOCKET) return kNoSocket;
  NotInherited(socket);
  if (nonBlocking) SetNonBlocking(Handle(socket), true);
  return Handle(socket);
}

void CloseHandle(SocketHandle handle) { ::closesocket(S(handle)); }

bool BindLoopback(SocketHandle handle, int port) {
  const sockaddr_in address = LoopbackAddress(port);
  return ::bind(S(handle), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0;
}

int LocalPort(SocketHandle handle) {
  sockaddr_in bound{};
  int length = sizeof(bound);
  if (::getsockname(S(handle), reinterpret_cast<sockaddr*>(&bound), &length) != 0) return -1;
  return ::ntohs(bound.sin_port);
}

bool Listen(SocketHandle handle, int backlog) { return ::listen(S(handle), backlog) == 0; }

int ConnectLoopback(SocketHandle handle, int port) {
  const sockaddr_in address = LoopbackAddress(port);
  return ::connect(S(handle), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0 ? 0 : -1;
}

SocketHandle Accept(SocketHandle listener, int* peerPort) {
  sockaddr_in peer{};
  int length = sizeof(peer);
  const SOCKET socket = ::accept(S(listener), reinterpret_cast<sockaddr*>(&peer), &length);
  if (socket == INVALID_SOCKET) return kNoSocket;
  NotInherited(socket);
  if (peerPort != nullptr) *peerPort = ::ntohs(peer.sin_port);
  return Handle(socket);
}

void Shutdown(SocketHandle handle) {
  ::shutdown(S(handle), SD_BOTH);
  ::CancelIoEx(reinterpret_cast<HANDLE>(S(handle)), nullptr);
}

std::int64_t Send(SocketHandle handle, const void* data, std::size_t length) {
  const int n = length > 0x40000000 ? 0x40000000 : static_cast<int>(length);
  const int sent = ::send(S(handle), static_cast<const char*>(data), n, 0);
  return sent == SOCKET_ERROR ? -1 : sent;
}

std::int64_t SendGather(SocketHandle handle, const Chunk* chunks, std::size_t count) {
  WSABUF buffers[kMaxChunks];
  if (count > kMaxChunks) count = kMaxChunks;
  for (std::size_t i = 0; i < count; ++i) {
    const std::size_t length = chunks[i].length > 0x40000000 ? 0x40000000 : chunks[i].length;
    buffers[i] = WSABUF{static_cast<ULONG>(length), static_cast<CHAR*>(const_cast<void*>(chunks[i].data))};
    if (length != chunks[i].length) {
      count = i + 1;  // the rest follows in the caller's next call
      break;
    }
  }
  DWORD sent = 0;
  if (::WSASend(S(handle), buffers, static_cast<DWORD>(count), &sent, 0, nullptr, nullptr) != 0) return -1;
  return sent;
}

std::int64_t Receive(SocketHandle handle, void* data, std::size_t length, ReceiveMode mode) {
  if (mode == ReceiveMode::kDontWait) {
    // Winsock has no per-call non-blocking flag, and switching the socket
    // itself would affect senders on other threads: ask first. A readable
    // socket's recv returns at once (data, end of stream or an error).
    PollEntry entry{handle, false, false};
    const int ready = Poll(&entry, 1, 0);
    if (ready < 0) return -1;
    if (ready == 0) {
      ::WSASetLastError(WSAEWOULDBLOCK);
      return -1;
    }
  }
  const int n = length > 0x40000000 ? 0x40000000 : static_cast<int>(length);
  const int got = ::recv(S(handle), static_cast<char*>(data), n, mode == ReceiveMode::kWaitAll ? MSG_WAITALL : 0);
  return got == SOCKET_ERROR ? -1 : got;
}

bool SetNoDelay(SocketHandle handle) {
  const BOOL on = TRUE;
  return ::setsockopt(S(handle), IPPROTO_TCP, TCP_NODELAY, reinterpret_cast<const char*>(&on), sizeof(on)) == 0;
}

bool SetNonBlocking(SocketHandle handle, bool nonBlocking) {
  u_long mode = nonBlocking ? 1 : 0;
  return ::ioctlsocket(S(handle), FIONBIO, &mode) == 0;
}

bool SetReceiveTimeout(SocketHandle handle, std::uint32_t ms) { return SetTimeout(handle, SO_RCVTIMEO, ms); }

bool SetSendTimeout(SocketHandle handle, std::uint32_t ms) { return SetTimeout(handle, SO_SNDTIMEO, ms); }

int PendingError(SocketHandle handle) {
  int error = 0;
  int length = sizeof(error);
  if (::getsockopt(S(handle), SOL_SOCKET, SO_ERROR, reinterpret_cast<char*>(&error), &length) != 0) return -1;
  return error;
}

int Poll(PollEntry* entries, std::size_t count, int timeoutMs) {
  if (count == 0) {
    // WSAPoll refuses an empty list; the wait alone is what was asked for.
    if (timeoutMs > 0) std::this_thread::sleep_for(std::chrono::milliseconds(timeoutMs));
    return 0;
  }
  std::vector<WSAPOLLFD> fds(count);
  for (std::size_t i = 0; i < count; ++i) {
    fds[i] = WSAPOLLFD{S(entries[i].handle), entries[i].writable ? static_cast<SHORT>(POLLWRNORM) : kPollAskRead, 0};
  }
  const int ready = ::WSAPoll(fds.data(), static_cast<ULONG>(count), timeoutMs < 0 ? -1 : timeoutMs);
  for (std::size_t i = 0; i < count; ++i) entries[i].ready = ready > 0 && (fds[i].revents & kPollReady) != 0;
  return ready == SOCKET_ERROR ? -1 : ready;
}

bool MakeWakePair(WakePair* pair) {
  // Windows has no socketpair: a listener on 127.0.0.1 joins two sockets
  // and goes again at once.
  const SocketHandle listener = OpenTcp(false);
  if (listener == kNoSocket) return false;
  WakePair made;
  bool ok = BindLoopback(listener, 0) && Listen(listener, 1);
  const int port = ok ? LocalPort(listener) : -1;
  ok = ok && port > 0 && (made.write = OpenTcp(false)) != kNoSocket && ConnectLoopback(made.write, port) == 0 &&
       (made.read = Accept(listener, nullptr)) != kNoSocket;
  CloseHandle(listener);
  if (ok) {
    SetNoDelay(made.write);
    ok = SetNonBlocking(made.read, true) && SetNonBlocking(made.write, true);
  }
  if (!ok) {
    if (made.read != kNoSocket) CloseHandle(made.read);
    if (made.write != kNoSocket) CloseHandle(made.write);
    return false;
  }
  *pair = made;
  return true;
}

}  // namespace sys
}  // namespace pm::ip
