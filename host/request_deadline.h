// How long a request's head and body may take to arrive, and reading a body
// against that deadline. One total deadline per request, not a limit per
// byte: a client that sends a byte now and then must not keep a request
// process for ever.
//
// A request may take `allowance_seconds` from its start (kivo-webd: when its
// connection was accepted; entry.cgi: when it started) plus one second for
// every kMinBodyBytesPerSecond bytes of CONTENT_LENGTH, so that a large
// upload over a slow line still arrives in time.
//
// Header-only: the multipart reader is a library of its own that reads the
// body against the same deadline.
#pragma once

#include <cerrno>
#include <climits>
#include <cstddef>
#include <cstdint>
#include <ctime>
#include <sys/types.h>
#include <unistd.h>

#include <poll.h>

// The allowance of a request without a configured one (entry.cgi, and
// kivo-webd's and the web server configuration's default).
constexpr int kDefaultRequestSeconds = 30;
// The slowest upload rate a request's deadline allows for (512 kbit/s).
constexpr uint64_t kMinBodyBytesPerSecond = 64 << 10;

// Milliseconds of the monotonic clock.
inline int64_t MonotonicMs() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<int64_t>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

// When a request started and what it is allowed.
struct RequestClock {
  int64_t started_ms = 0;  // MonotonicMs() at the start
  int allowance_seconds = kDefaultRequestSeconds;
};

// The MonotonicMs() by which the whole body of `content_length` bytes must
// have arrived.
inline int64_t BodyDeadlineMs(const RequestClock& clock, uint64_t content_length) {
  uint64_t rate_ms = content_length / kMinBodyBytesPerSecond * 1000 +
                     content_length % kMinBodyBytesPerSecond * 1000 / kMinBodyBytesPerSecond;
  return clock.started_ms + static_cast<int64_t>(clock.allowance_seconds) * 1000 +
         static_cast<int64_t>(rate_ms);
}

// read(2) on `fd` that waits for data no later than `deadline_ms`. Data that
// is there already is read even after the deadline. Returns what read returns;
// -1 with errno ETIMEDOUT when nothing came in time.
inline ssize_t ReadBeforeDeadline(int fd, void* buf, size_t size, int64_t deadline_ms) {
  for (;;) {
    int64_t left = deadline_ms - MonotonicMs();
    pollfd wait{fd, POLLIN, 0};
    int ready = poll(&wait, 1, left <= 0 ? 0 : left > INT_MAX ? INT_MAX : static_cast<int>(left));
    if (ready < 0 && errno != EINTR) return -1;
    if (ready == 0 && left <= 0) {
      errno = ETIMEDOUT;
      return -1;
    }
    if (ready <= 0) continue;
    ssize_t n = read(fd, buf, size);
    if (n < 0 && (errno == EINTR || errno == EAGAIN || errno == EWOULDBLOCK)) continue;
    return n;
  }
}
