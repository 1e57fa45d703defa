#include "monitor_queue_subscription.h"

#include <errno.h>
#include <poll.h>
#include <stdint.h>
#include <string.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/timerfd.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <deque>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "platform/scoped.h"
#include "subscription/line_reader.h"
#include "subscription/wire_record.h"

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

using platform::ScopedFd;
using subscription::LineReader;
using subscription::ParseWireRecord;
using subscription::WireRecord;

constexpr int64_t kFirstBackoffMs = 100;
constexpr int64_t kMaxBackoffMs = 5000;
constexpr int64_t kReplyWaitMs = 10000;

int64_t NowMs() {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return int64_t(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

const char* TypeName(_tag_monitor_queue_type_ type) {
  return type == MONITOR_QUEUE_TYPE_SHARE_DIR ? "share"
         : type == MONITOR_QUEUE_TYPE_ETC_DIR ? "etc"
                                              : "local-etc";
}

// |text| as a JSON string: the bytes that are not UTF-8 as \udcXY, as the
// daemon writes them.
void AppendJsonString(std::string* out, const std::string& text) {
  static const char kHex[] = "0123456789abcdef";
  out->push_back('"');
  const unsigned char* p = reinterpret_cast<const unsigned char*>(text.data());
  const unsigned char* end = p + text.size();
  while (p < end) {
    const unsigned char c = *p;
    size_t n = c < 0x80             ? 1
               : (c & 0xe0) == 0xc0 ? 2
               : (c & 0xf0) == 0xe0 ? 3
               : (c & 0xf8) == 0xf0 ? 4
                                    : 0;
    bool valid = n > 0 && size_t(end - p) >= n;
    for (size_t i = 1; valid && i < n; ++i) valid = (p[i] & 0xc0) == 0x80;
    if (valid && n > 1) {
      const uint32_t point =
          n == 2   ? (uint32_t(c & 0x1f) << 6) | (p[1] & 0x3f)
          : n == 3 ? (uint32_t(c & 0x0f) << 12) | (uint32_t(p[1] & 0x3f) << 6) | (p[2] & 0x3f)
                   : (uint32_t(c & 0x07) << 18) | (uint32_t(p[1] & 0x3f) << 12) |
                         (uint32_t(p[2] & 0x3f) << 6) | (p[3] & 0x3f);
      const uint32_t least = n == 2 ? 0x80 : n == 3 ? 0x800 : 0x10000;
      valid = point >= least && point <= 0x10ffff && (point < 0xd800 || point > 0xdfff);
    }
    if (!valid) {
      *out += "\\udc";
      out->push_back(kHex[c >> 4]);
      out->push_back(kHex[c & 15]);
      ++p;
      continue;
    }
    if (c == '"' || c == '\\') {
      out->push_back('\\');
      out->push_back(char(c));
    } else if (c < 0x20) {
      *out += "\\u00";
      out->push_back(kHex[c >> 4]);
      out->push_back(kHex[c & 15]);
    } else {
      out->append(reinterpret_cast<const char*>(p), n);
    }
    p += n;
  }
  out->push_back('"');
}

}  // namespace

namespace subscription {

// A subscription the user asked for.
struct Wanted {
  std::string name;
  bool exact;  // of one type and file
  _tag_monitor_queue_type_ type;
  std::string file;
};

// A queue records came from, and the last one delivered.
struct Followed {
  _tag_monitor_queue_type_ type;
  std::string file, name;
  uint64_t last;
};

}  // namespace subscription

using subscription::Followed;
using subscription::Wanted;

struct MonitorQueueSubscriptionData {
  std::string socket_path;
  ScopedFd socket, poller, ready, timer;
  LineReader lines;
  WireRecord record;
  std::vector<Wanted> wanted;
  std::vector<Followed> followed;
  // Delivered before any line, each with its line (empty: made here).
  std::deque<std::pair<MonitorQueueEvent, std::string>> pending;
  const char* line_data = nullptr;  // the line NextRecord parsed last
  size_t line_size = 0;
  std::string line;    // the line of the event Next delivered last
  std::string answer;  // the reply or error line AwaitReply found last
  std::string reply;   // the line that answered the last Subscribe
  std::string journal, error, request;
  std::string failure;  // why the connection was lost or could not be made
  bool closed = false;
  bool signalled = false;    // |ready| holds a count
  int64_t reconnect_at = 0;  // while disconnected, when to try again
  int64_t backoff = kFirstBackoffMs;

  explicit MonitorQueueSubscriptionData(std::string path) : socket_path(std::move(path)) {
    poller.Reset(epoll_create1(EPOLL_CLOEXEC));
    ready.Reset(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    timer.Reset(timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK));
    if (!poller.valid() || !ready.valid() || !timer.valid() || !Watch(ready.get()) ||
        !Watch(timer.get())) {
      poller.Reset();
    }
  }

  bool Watch(int fd) {
    struct epoll_event event = {};
    event.events = EPOLLIN;
    event.data.fd = fd;
    return epoll_ctl(poller.get(), EPOLL_CTL_ADD, fd, &event) == 0;
  }

  // Keeps |ready| readable exactly while something is at hand.
  void Signal() {
    const bool want = !pending.empty() || lines.HasLine();
    if (want == signalled || !ready.valid()) return;
    uint64_t value = 1;
    if (want) {
      signalled = write(ready.get(), &value, sizeof(value)) == ssize_t(sizeof(value));
    } else {
      signalled = !(read(ready.get(), &value, sizeof(value)) == ssize_t(sizeof(value)));
    }
  }

  void Disconnect(const std::string& why) {
    if (!why.empty()) error = why;
    failure = error;
    socket.Reset();  // closing it also takes it out of |poller|
    lines.Clear();
    reconnect_at = NowMs() + backoff;
    backoff = std::min(backoff * 2, kMaxBackoffMs);
    if (timer.valid()) {
      const int64_t wait = reconnect_at - NowMs();
      struct itimerspec when = {};
      when.it_value.tv_sec = wait / 1000;
      when.it_value.tv_nsec = long(wait % 1000) * 1000000 + 1;
      timerfd_settime(timer.get(), 0, &when, nullptr);
    }
  }

  // Connects and checks that root serves the socket.
  bool Connect() {
    ScopedFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    struct sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    if (socket_path.size() >= sizeof(address.sun_path)) {
      error = "socket path too long: " + socket_path;
      return false;
    }
    memcpy(address.sun_path, socket_path.c_str(), socket_path.size() + 1);
    if (!fd.valid() ||
        connect(fd.get(), reinterpret_cast<struct sockaddr*>(&address), sizeof(address)) != 0) {
      error = "cannot connect to " + socket_path + ": " + strerror(errno);
      return false;
    }
    struct ucred peer = {};
    socklen_t size = sizeof(peer);
    if (getsockopt(fd.get(), SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0) {
      error = "cannot tell who serves " + socket_path + ": " + strerror(errno);
      return false;
    }
    if (peer.uid != 0) {
      error = socket_path + " is served by uid " + std::to_string(peer.uid) + " (pid " +
              std::to_string(peer.pid) + "), not by root";
      return false;
    }
    struct timeval send_limit = {5, 0};
    setsockopt(fd.get(), SOL_SOCKET, SO_SNDTIMEO, &send_limit, sizeof(send_limit));
    if (poller.valid()) {
      struct epoll_event event = {};
      event.events = EPOLLIN;
      event.data.fd = fd.get();
      if (epoll_ctl(poller.get(), EPOLL_CTL_ADD, fd.get(), &event) != 0) {
        error = std::string("cannot watch the connection: ") + strerror(errno);
        return false;
      }
    }
    lines.Clear();
    socket.Reset(fd.Release());
    return true;
  }

  bool Send(const std::string& text) {
    size_t sent = 0;
    while (sent < text.size()) {
      const ssize_t n = send(socket.get(), text.data() + sent, text.size() - sent, MSG_NOSIGNAL);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) {
        error = std::string("cannot send to the daemon: ") + strerror(errno);
        return false;
      }
      sent += size_t(n);
    }
    return true;
  }

  void AppendSubscribe(const std::string& name, bool exact, _tag_monitor_queue_type_ type,
                       const std::string& file, bool has_since, uint64_t since) {
    request += "{\"request\":\"subscribe\",\"queue\":";
    AppendJsonString(&request, name);
    if (exact) {
      request += ",\"type\":\"";
      request += TypeName(type);
      request += "\",\"file\":";
      AppendJsonString(&request, file);
    }
    if (has_since) request += ",\"since\":" + std::to_string(since);
    request += "}\n";
  }

  // Waits for the socket until |deadline| (-1: without end); false on a
  // time-out.  Reads what came; a connection lost is then disconnected.
  bool Receive(int64_t deadline) {
    struct pollfd p = {socket.get(), POLLIN, 0};
    const int64_t left = deadline < 0 ? -1 : std::max<int64_t>(0, deadline - NowMs());
    const int n = poll(&p, 1, int(std::min<int64_t>(left, INT32_MAX)));
    if (n < 0 && errno == EINTR) return true;
    if (n == 0) return false;
    const ssize_t got = lines.ReadFrom(socket.get());
    if (got > 0 || (got < 0 && (errno == EINTR || errno == EAGAIN))) return true;
    Disconnect(got == 0 ? "the daemon closed the connection"
               : errno == EOVERFLOW
                   ? "a line from the daemon is longer than 1048576 bytes"
                   : std::string("cannot read from the daemon: ") + strerror(errno));
    return true;
  }

  Followed* Find(_tag_monitor_queue_type_ type, const std::string& file, const std::string& name) {
    for (Followed& queue : followed) {
      if (queue.type == type && queue.file == file && queue.name == name) return &queue;
    }
    return nullptr;
  }

  // The queue of |record|, followed from now on when it was not.
  Followed& Queue(_tag_monitor_queue_type_ type, const std::string& file, const std::string& name) {
    if (Followed* queue = Find(type, file, name)) return *queue;
    followed.push_back(Followed{type, file, name, 0});
    return followed.back();
  }

  // Handles the line in |record|: true with |event| filled when it is a
  // record to deliver.
  bool Handle(MonitorQueueEvent& event) {
    const WireRecord& r = record;
    if (r.has_error) {
      error = "the daemon says: " + r.error;
      return false;
    }
    if (r.has_reply) return false;
    const int kinds = int(r.has_path) + int(r.lost) + int(r.removed) + int(r.registered) +
                      int(r.has_rescan) + int(r.has_missed);
    if (!r.has_queue || !r.has_type || !r.has_file || kinds != 1 || r.has_seq == r.has_missed ||
        r.has_path != r.has_mask) {
      error = "a line from the daemon is not a record; skipped";
      return false;
    }
    Followed& queue = Queue(r.type, r.file, r.queue);
    if (r.has_seq) {
      if (r.seq <= queue.last) return false;
      queue.last = r.seq;
    }
    event._kind = r.has_path     ? MonitorQueueEvent::EVENT
                  : r.lost       ? MonitorQueueEvent::LOST
                  : r.removed    ? MonitorQueueEvent::REMOVED
                  : r.registered ? MonitorQueueEvent::REGISTERED
                  : r.has_rescan ? MonitorQueueEvent::RESCAN
                                 : MonitorQueueEvent::MISSED;
    event._queue.assign(r.queue);
    event._type = r.type;
    event._file.assign(r.file);
    event._seq = r.seq;
    if (r.has_path) {
      event._path.assign(r.path);
    } else if (r.has_rescan) {
      event._path.assign(r.rescan);
    } else {
      event._path.clear();
    }
    event._mask = r.mask;
    event._offline = r.offline;
    event._missed = r.missed;
    return true;
  }

  // Parses the next buffered line into |record|; false when none is
  // whole.  A line that is not JSON is skipped with |error| set.
  bool NextRecord() {
    const char* data;
    size_t size;
    while (lines.NextLine(&data, &size)) {
      if (ParseWireRecord(data, size, &record)) {
        line_data = data;
        line_size = size;
        return true;
      }
      error = "a line from the daemon is not well-formed; skipped";
    }
    return false;
  }

  // Reads lines until the reply to the request last sent: true with
  // |record| holding it, false on an error reply or a lost connection
  // (|error| says which).  Records read meanwhile wait in |pending|.
  bool AwaitReply(const char* kind) {
    const int64_t deadline = NowMs() + kReplyWaitMs;
    answer.clear();
    while (socket.valid()) {
      while (NextRecord()) {
        if ((record.has_reply && record.reply == kind) || record.has_error) {
          answer.assign(line_data, line_size);
        }
        if (record.has_reply && record.reply == kind) return true;
        if (record.has_error) {
          error = "the daemon says: " + record.error;
          return false;
        }
        MonitorQueueEvent event;
        if (Handle(event))
          pending.emplace_back(std::move(event), std::string(line_data, line_size));
      }
      if (!Receive(deadline)) {
        error = std::string("no reply from the daemon to \"") + kind + "\" within 10 s";
        Disconnect("");
        return false;
      }
    }
    return false;
  }

  // A connection made again: compares the journal, then subscribes to
  // every wanted queue again, after the last record delivered of each.
  // Leaves a failure disconnected, the next attempt scheduled.
  bool Resume() {
    uint64_t expired;
    if (timer.valid()) (void)!read(timer.get(), &expired, sizeof(expired));
    if (!Connect()) {
      Disconnect("");
      return false;
    }
    if (!Send("{\"request\":\"status\"}\n") || !AwaitReply("status")) {
      if (socket.valid()) Disconnect("");
      return false;
    }
    const bool reset = !journal.empty() && record.has_journal && record.journal != journal;
    if (record.has_journal) journal = record.journal;
    if (reset) {
      for (Followed& queue : followed) {
        MonitorQueueEvent event{MonitorQueueEvent::RESCAN,
                                queue.name,
                                queue.type,
                                queue.file,
                                0,
                                std::string(),
                                0,
                                false,
                                0};
        pending.emplace_back(std::move(event), std::string());
        queue.last = 0;
      }
    }
    request.clear();
    for (const Wanted& want : wanted) {
      if (want.exact) {
        const Followed* queue = reset ? nullptr : Find(want.type, want.file, want.name);
        AppendSubscribe(want.name, true, want.type, want.file, queue != nullptr,
                        queue != nullptr ? queue->last : 0);
        continue;
      }
      // Each queue of the name after its own last record, then the name
      // for the queues registered later.
      for (const Followed& queue : followed) {
        if (!reset && queue.name == want.name) {
          AppendSubscribe(queue.name, true, queue.type, queue.file, true, queue.last);
        }
      }
      AppendSubscribe(want.name, false, want.type, want.file, false, 0);
    }
    if (!Send(request)) {
      Disconnect("");
      return false;
    }
    backoff = kFirstBackoffMs;
    return true;
  }

  bool Subscribe(const std::string& name, bool exact, _tag_monitor_queue_type_ type,
                 const std::string& file, bool has_since, uint64_t since) {
    if (closed) {
      error = "closed";
      return false;
    }
    if (!socket.valid()) {
      if (!wanted.empty()) {
        if (!Resume()) return false;
      } else if (!Connect()) {
        return false;
      }
    }
    request.clear();
    AppendSubscribe(name, exact, type, file, has_since, since);
    if (!Send(request)) {
      Disconnect("");
      return false;
    }
    const bool replied = AwaitReply("subscribe");
    reply.swap(answer);
    if (!replied) return false;
    if (record.has_journal && journal.empty()) journal = record.journal;
    for (size_t i = 0; i < record.queue_count; ++i) {
      const subscription::WireQueue& listed = record.queues[i];
      // A queue followed already goes on after the record last delivered.
      if (Find(listed.type, listed.file, name) != nullptr) continue;
      // A number beyond the queue's last (of another journal) brings every
      // kept record: take them all.
      Queue(listed.type, listed.file, name).last = !has_since            ? listed.seq
                                                   : since <= listed.seq ? since
                                                                         : 0;
    }
    wanted.push_back(Wanted{name, exact, type, file});
    error.clear();
    return true;
  }
};

MonitorQueueSubscription::MonitorQueueSubscription(std::string socket_path)
    : data_(new MonitorQueueSubscriptionData(std::move(socket_path))) {}

MonitorQueueSubscription::~MonitorQueueSubscription() = default;

// Records read with a reply are buffered: Signal tells Fd's watchers.
bool MonitorQueueSubscription::Subscribe(const std::string& name) {
  const bool ok =
      data_->Subscribe(name, false, MONITOR_QUEUE_TYPE_SHARE_DIR, std::string(), false, 0);
  data_->Signal();
  return ok;
}

bool MonitorQueueSubscription::Subscribe(const std::string& name, uint64_t since) {
  const bool ok =
      data_->Subscribe(name, false, MONITOR_QUEUE_TYPE_SHARE_DIR, std::string(), true, since);
  data_->Signal();
  return ok;
}

bool MonitorQueueSubscription::Subscribe(const std::string& name, _tag_monitor_queue_type_ type,
                                         const std::string& file) {
  const bool ok = data_->Subscribe(name, true, type, file, false, 0);
  data_->Signal();
  return ok;
}

bool MonitorQueueSubscription::Subscribe(const std::string& name, _tag_monitor_queue_type_ type,
                                         const std::string& file, uint64_t since) {
  const bool ok = data_->Subscribe(name, true, type, file, true, since);
  data_->Signal();
  return ok;
}

int MonitorQueueSubscription::Fd() const {
  return data_->closed || !data_->poller.valid() ? -1 : data_->poller.get();
}

bool MonitorQueueSubscription::Next(MonitorQueueEvent& event, int timeout_ms) {
  MonitorQueueSubscriptionData& d = *data_;
  const int64_t deadline = timeout_ms < 0 ? -1 : NowMs() + timeout_ms;
  for (;;) {
    if (d.closed) {
      d.error = "closed";
      return false;
    }
    if (!d.pending.empty()) {
      event = std::move(d.pending.front().first);
      d.line.swap(d.pending.front().second);
      d.pending.pop_front();
      d.Signal();
      return true;
    }
    if (d.socket.valid()) {
      while (d.NextRecord()) {
        if (d.Handle(event)) {
          d.line.assign(d.line_data, d.line_size);
          d.Signal();
          return true;
        }
      }
      if (d.Receive(deadline)) continue;
    } else if (d.wanted.empty()) {
      d.error = "not subscribed";
      return false;
    } else {
      const int64_t now = NowMs();
      if (now >= d.reconnect_at) {
        d.Resume();
        continue;
      }
      const int64_t until = deadline < 0 ? d.reconnect_at : std::min(deadline, d.reconnect_at);
      if (until > now) usleep(useconds_t(std::min<int64_t>(until - now, 1000000) * 1000));
      if (deadline < 0 || NowMs() < deadline) continue;
    }
    d.error = d.socket.valid() ? "timed out" : "timed out while reconnecting: " + d.failure;
    d.Signal();
    return false;
  }
}

std::string MonitorQueueSubscription::Journal() const { return data_->journal; }

void MonitorQueueSubscription::Close() {
  data_->closed = true;
  data_->socket.Reset();
  data_->poller.Reset();
  data_->ready.Reset();
  data_->timer.Reset();
  data_->pending.clear();
  data_->lines.Clear();
}

bool MonitorQueueSubscription::Connected() const { return data_->socket.valid(); }

const std::string& MonitorQueueSubscription::LastError() const { return data_->error; }

const std::string& MonitorQueueSubscription::Reply() const { return data_->reply; }

const std::string& MonitorQueueSubscription::Line() const { return data_->line; }

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
