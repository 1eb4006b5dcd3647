// Reading a connection's frames within the byte budget and the in-flight
// cap, and serving them: inline on the poller or on the listener queue.
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>

#include "platform/Log.h"
#include "platform/RequestListenerImpl.h"

namespace platform {

namespace {

constexpr size_t kReadChunk = 64 * 1024;
// Read ahead when no frame is pending: most requests fit in it whole.
constexpr size_t kSmallFrame = 1024;
// Requests of one connection queued or running at once; past this the
// connection is not read until some finish, so a flood cannot grow memory.
constexpr int kMaxInFlight = 256;

}  // namespace

using request_listener::drain;

void RequestListener::Impl::runEvent(const ClientRef& client, RequestEvent& event) {
  const size_t charge = event.charge;
  handler(client->connection, event);
  event.message.reset();
  finishEvent(client, charge);
}

void RequestListener::Impl::finishEvent(const ClientRef& client, size_t charge) {
  client->touch();
  budget->give(charge, client->uid);
  if (client->inFlight.fetch_sub(1) == kMaxInFlight) {
    bool resume = false;
    {
      std::lock_guard<std::mutex> hold(client->pauseLock);
      resume = client->paused;
      client->paused = false;
    }
    // This thread now holds the connection until it re-arms it.
    if (resume) serveClient(client, false);
  }
  transactionEnd();
}

// Reads toward the next whole frame: the length field alone, then (with the
// whole frame taken from the budget) the rest of the frame and the next
// length field, so that no byte is read that the budget has not admitted.
// With nothing buffered, a small read taken from the budget ahead brings a
// small frame in whole with one recv.
RequestListener::Impl::ReadResult RequestListener::Impl::readEvent(const ClientRef& client, RequestEvent& event) {
  uint8_t buffer[kReadChunk];
  frame::Decoder& decoder = client->decoder;
  const int fd = client->connection->fd();
  for (;;) {
    if (auto raw = decoder.next()) {
      event.messageId = raw->messageId;
      event.charge = client->reserved;
      client->reserved = 0;
      uint64_t footprint = 0;
      event.message = frame::decodeMessage(raw->payload, &event.failure, &footprint);
      raw->payload = {};
      // The decoded message replaces the frame's bytes; what it costs beyond
      // them is held too. It is admitted work: it may go over the budget.
      if (footprint > event.charge) {
        budget->force(footprint - event.charge, client->uid);
        event.charge = footprint;
      }
      client->touch();
      return ReadResult::Event;
    }
    if (decoder.failed()) {
      event.failure = decoder.failure();
      return ReadResult::Event;  // no message: the connection closes
    }
    size_t want = 4 - std::min<size_t>(decoder.buffered(), 4);
    if (const size_t whole = decoder.pendingFrameSize()) {
      if (client->reserved < whole) {
        client->parked = true;
        std::weak_ptr<Client> weak = client;
        auto resume = [this, weak] {
          if (ClientRef c = weak.lock()) {
            c->parked = false;
            serveClient(c, false);
          }
        };
        if (!budget->takeOrWait(whole - client->reserved, client->uid, std::move(resume))) {
          const auto& peer = client->connection->peer();
          QRTLog(kLogDebug, "Request buffer budget full: connection of pid %d waits for %zu bytes",
                 peer ? static_cast<int>(peer->pid) : 0, whole);
          return ReadResult::Parked;
        }
        client->parked = false;
        client->reserved = whole;
      }
      want = whole - decoder.buffered() + 4;
    } else if (decoder.buffered() == 0 && client->reserved == 0 && budget->tryTake(kSmallFrame, client->uid)) {
      client->reserved = kSmallFrame;
      want = kSmallFrame;
    }
    ssize_t n = ::recv(fd, buffer, std::min(want, sizeof buffer), 0);
    if (n > 0) {
      decoder.append(buffer, static_cast<size_t>(n));
      continue;
    }
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      // A read ahead that found nothing is not held while the client idles.
      if (decoder.buffered() == 0 && client->reserved != 0) {
        budget->give(client->reserved, client->uid);
        client->reserved = 0;
      }
      return ReadResult::Empty;
    }
    return ReadResult::Closed;
  }
}

void RequestListener::Impl::serveClient(const ClientRef& client, bool mayServeInline) {
  for (;;) {
    std::vector<RequestEvent> events;
    bool closing = stopping.load() || client->connection->cancelled();
    bool capped = false;  // stopped at the load limit: more frames may wait in the socket
    ReadResult read = ReadResult::Empty;
    while (!closing) {
      if (client->inFlight.load() + static_cast<int>(events.size()) >= kMaxInFlight) {
        capped = true;
        break;
      }
      RequestEvent event;
      read = readEvent(client, event);
      if (read != ReadResult::Event) {
        closing = read == ReadResult::Closed;
        break;
      }
      closing = !event.message;  // nothing after a frame without reply context is served
      events.push_back(std::move(event));
    }
    client->inFlight.fetch_add(static_cast<int>(events.size()));
    for (size_t i = 0; i < events.size(); ++i) transactionBegin();

    if (closing) {
      dropClient(client);
      return dispatch(client, events, mayServeInline);
    }
    if (!capped) {
      // Parked: the budget's waiting list holds the connection now.
      if (read == ReadResult::Empty) armClient(client->connection->fd());
      return dispatch(client, events, mayServeInline);
    }
    bool paused = false;
    {
      // Checked under the lock that finishEvent takes, so a request finishing
      // meanwhile either sees the pause or leaves a load this check sees fall.
      std::lock_guard<std::mutex> hold(client->pauseLock);
      if (client->inFlight.load() >= kMaxInFlight) {
        client->paused = true;  // the request that brings the load down serves it again
        paused = true;
      }
    }
    // Dispatched with the lock released: a request served inline here may be
    // the one that brings the load down, and finishEvent takes the lock.
    if (paused) return dispatch(client, events, mayServeInline);
    dispatch(client, events, false);  // the load fell meanwhile: read on
  }
}

// The last request is served on this thread if another poller is free; the
// rest run on the queue, so that a pipelined batch is served concurrently.
void RequestListener::Impl::dispatch(const ClientRef& client, std::vector<RequestEvent>& events, bool mayServeInline) {
  const bool inlineLast = mayServeInline && !events.empty() && idlePollers.load() > 0;
  const size_t queued = inlineLast ? events.size() - 1 : events.size();
  for (size_t i = 0; i < queued; ++i) {
    queue->async([this, client, event = std::move(events[i])]() mutable { runEvent(client, event); });
  }
  if (inlineLast) runEvent(client, events.back());
}

void RequestListener::Impl::serveWaiters() {
  drain(budgetFd);
  arm(budgetFd, EPOLLIN | EPOLLONESHOT);
  for (ByteBudget::Waiter& waiter : budget->takeWaiters()) waiter();
}

}  // namespace platform
