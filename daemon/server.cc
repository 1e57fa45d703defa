// The Unix socket of the daemon and the clients on it.

#include "server.h"

#include <errno.h>
#include <grp.h>
#include <pwd.h>
#include <string.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <memory>
#include <sstream>

#include <json/json.h>

#include "json_writer.h"
#include "request.h"
#include "root_owned.h"
#include "text.h"

namespace zorvnotifyd {
namespace {

using zorvcommon::Quoted;

// How much a client behind the records kept in memory reads of a journal
// at a time: what its buffer takes in a turn of the loop, never the whole
// journal.
constexpr size_t kJournalRead = 64 * 1024;

// A request line longer than this is refused and the client let go; it
// bounds the memory a parsed request takes.
constexpr size_t kMaxRequest = 64 * 1024;

// What the subscriptions of one client may hold: far more than a real
// client needs, and a bound on the memory a client makes the daemon keep.
constexpr size_t kMaxSubscriptions = 1024;
constexpr size_t kMaxSubscriptionBytes = 1024 * 1024;  // of queue and file names

// {"error":MESSAGE}
std::string ErrorLine(const std::string& message) {
  std::string line = "{";
  AppendJsonField(&line, "error", message);
  return line + "}\n";
}

}  // namespace

struct Server::Client {
  UniqueFd fd;
  std::string who;
  std::string in;
  std::string out;
  size_t sent = 0;
  std::map<QueueLog*, uint64_t> next;  // the next record to deliver of each followed queue
  // Records read from a journal, for a queue whose next record is no
  // longer in memory.
  std::map<QueueLog*, std::deque<JournalRecord>> read;
  std::vector<Subscription> subscriptions;
  bool closing = false;   // let go once the output is written
  bool behind = false;    // records wait in the logs: Fill delivers them in order
  bool sent_all = false;  // the client shut its sending side
  uint32_t interest = 0;  // what epoll waits for on it
  bool dirty = false;     // in dirty_: Deliver looks at it
  std::list<Client>::iterator self;
  // The bytes of the queue and file names in |subscriptions|, which are
  // all different.
  size_t subscription_bytes = 0;
};

Server::Server(ServerOptions options, QueueLogs& logs, std::string run_id,
               std::function<std::string()> status)
    : options_(std::move(options)),
      logs_(logs),
      run_id_(std::move(run_id)),
      status_(std::move(status)) {}

Server::~Server() {
  full_ = false;  // not "accepting again" while every client is let go
  while (!clients_.empty()) Drop(clients_.front());
  // Only the socket file this daemon bound: one that replaced it belongs to
  // someone else.
  struct stat st;
  if (listener_.get() >= 0 && lstat(options_.socket_path.c_str(), &st) == 0 &&
      st.st_dev == bound_.st_dev && st.st_ino == bound_.st_ino) {
    unlink(options_.socket_path.c_str());
  }
}

bool Server::Listen() {
  std::string reason;
  UniqueFd fd = Bind(&bound_, &reason);
  if (fd.get() < 0 || !Use(std::move(fd), &reason)) {
    syslog(LOG_ERR, "cannot listen on %s: %s", Quoted(options_.socket_path).c_str(),
           reason.c_str());
    return false;
  }
  return true;
}

void Server::Relisten(double retry_seconds) {
  const std::string& path = options_.socket_path;
  struct stat st;
  if (lstat(path.c_str(), &st) == 0 && st.st_dev == bound_.st_dev && st.st_ino == bound_.st_ino) {
    return;
  }
  // Until a new socket is bound, the old one still serves the clients it
  // has, and the check repeats at the next call.
  std::string reason;
  struct stat bound;
  UniqueFd fd = Bind(&bound, &reason);
  if (fd.get() < 0 || !Use(std::move(fd), &reason)) {
    if (reason != relisten_failure_) {
      syslog(LOG_ERR,
             "the socket file %s was removed or replaced, and a new one cannot be made: %s; "
             "trying again every %g s",
             Quoted(path).c_str(), reason.c_str(), retry_seconds);
    }
    relisten_failure_ = reason;
    return;
  }
  bound_ = bound;
  relisten_failure_.clear();
  syslog(LOG_WARNING, "the socket file %s was removed or replaced: listening on a new one",
         Quoted(path).c_str());
}

UniqueFd Server::Bind(struct stat* bound, std::string* reason) {
  const std::string& path = options_.socket_path;
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof(address.sun_path)) {
    *reason = "the path is empty or too long";
    return UniqueFd();
  }
  path.copy(address.sun_path, path.size());
  const size_t slash = path.rfind('/');
  const std::string dir = slash == std::string::npos ? "."
                          : slash == 0               ? "/"
                                                     : path.substr(0, slash);
  // The service manager makes the default directory; started by hand, the
  // daemon makes it itself: that directory alone, never its parents, and
  // mkdir never follows a link there.
  if (path == kDefaultSocketPath) {
    const mode_t old_mask = umask(0);
    if (mkdir(dir.c_str(), 0755) == 0) {
      syslog(LOG_NOTICE, "made the socket's directory %s", Quoted(dir).c_str());
    }
    umask(old_mask);
  }
  // A directory that someone else may write lets them plant a file where
  // the socket goes, or a socket of their own that clients would trust.
  struct stat st;
  if (lstat(dir.c_str(), &st) != 0) {
    *reason = "its directory " + Quoted(dir) + " cannot be used: " + strerror(errno);
    return UniqueFd();
  }
  if (!S_ISDIR(st.st_mode)) {
    *reason = "its directory " + Quoted(dir) + " is not a directory (a link is not followed)";
    return UniqueFd();
  }
  if (st.st_uid != 0 || (st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
    char mode[8];
    snprintf(mode, sizeof(mode), "%04o", unsigned(st.st_mode & 07777));
    *reason = "its directory " + Quoted(dir) + " is owned by uid " + std::to_string(st.st_uid) +
              " with mode " + mode + "; it must be root's and writable by root alone";
    return UniqueFd();
  }
  // Nor may anyone else write a directory above it (but for a sticky one of
  // root's, as /tmp), or they could move it away and put their own there.
  if (std::string why = zorvcommon::UntrustedDirectories(dir, true); !why.empty()) {
    *reason = why;
    return UniqueFd();
  }
  // A socket left by an earlier run is replaced; nothing else ever is.
  if (lstat(path.c_str(), &st) == 0) {
    if (!S_ISSOCK(st.st_mode)) {
      *reason = "another kind of file is there";
      return UniqueFd();
    }
    UniqueFd probe(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (probe.get() >= 0 &&
        connect(probe.get(), reinterpret_cast<struct sockaddr*>(&address), sizeof(address)) == 0) {
      *reason = "another daemon listens there";
      return UniqueFd();
    }
    unlink(path.c_str());
  }
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  // The socket is made with its final mode: no moment when others could
  // connect.
  const mode_t old_mask = umask(options_.group_allowed ? 0117 : 0177);
  const bool made = fd.get() >= 0 && bind(fd.get(), reinterpret_cast<struct sockaddr*>(&address),
                                          sizeof(address)) == 0;
  const int error = errno;
  umask(old_mask);
  if (!made || listen(fd.get(), 64) != 0 ||
      (options_.group_allowed && lchown(path.c_str(), -1, options_.group) != 0) ||
      lstat(path.c_str(), bound) != 0) {
    *reason = strerror(made ? errno : error);
    if (made) unlink(path.c_str());
    return UniqueFd();
  }
  return fd;
}

bool Server::Use(UniqueFd listener, std::string* reason) {
  if (epoll_.get() < 0) epoll_ = UniqueFd(epoll_create1(EPOLL_CLOEXEC));
  struct epoll_event event = {};
  event.events = EPOLLIN;
  event.data.ptr = nullptr;  // the listener
  if (epoll_.get() < 0 || epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, listener.get(), &event) != 0) {
    *reason = std::string("cannot wait for clients: ") + strerror(errno);
    unlink(options_.socket_path.c_str());  // the file |listener| was just bound to
    return false;
  }
  if (listener_.get() >= 0) Accept();  // connected before the old socket file went
  listener_ = std::move(listener);     // closing the old one takes it out of epoll
  accepting_ = true;
  return true;
}

void Server::Watch(Client& client) {
  // Input while the client has room for replies and may still send; output
  // while some waits, or records do (either goes as the socket takes it).
  uint32_t interest = 0;
  if (Room(client) && !client.sent_all) interest |= EPOLLIN;
  if (client.sent < client.out.size() || client.behind) interest |= EPOLLOUT;
  if (interest == client.interest) return;
  struct epoll_event event = {};
  event.events = interest;
  event.data.ptr = &client;
  epoll_ctl(epoll_.get(), EPOLL_CTL_MOD, client.fd.get(), &event);
  client.interest = interest;
}

void Server::Touch(Client& client) {
  if (client.dirty) return;
  client.dirty = true;
  dirty_.push_back(&client);
}

void Server::StopAccepting(int error) {
  if (accepting_ && epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, listener_.get(), nullptr) == 0) {
    accepting_ = false;
  }
  if (starved_) return;
  starved_ = true;
  syslog(LOG_ERR,
         "cannot accept clients: %s (%zu connected); waiting until one leaves, and trying "
         "again periodically",
         strerror(error), clients_.size());
}

void Server::ResumeAccepting() {
  if (accepting_) return;
  struct epoll_event event = {};
  event.events = EPOLLIN;
  event.data.ptr = nullptr;  // the listener
  accepting_ = epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, listener_.get(), &event) == 0;
}

void Server::Tick(double retry_seconds) {
  ResumeAccepting();
  Relisten(retry_seconds);
}

void Server::Handle() {
  struct epoll_event events[64];
  const int n = epoll_wait(epoll_.get(), events, 64, 0);
  for (int i = 0; i < n; ++i) {
    if (events[i].data.ptr == nullptr) {
      Accept();
      continue;
    }
    Client& client = *static_cast<Client*>(events[i].data.ptr);
    if (events[i].events & EPOLLIN) Read(client);
    // Gone for good (closed, both ways shut): forgotten at once.  A client
    // that only shut its sending side still gets its replies and records.
    if ((events[i].events & (EPOLLERR | EPOLLHUP)) || client.fd.get() < 0 ||
        ((events[i].events & EPOLLOUT) && !Flush(client))) {
      Drop(client);
      continue;
    }
    Watch(client);
  }
}

void Server::Accept() {
  for (;;) {
    UniqueFd fd(accept4(listener_.get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
    if (fd.get() < 0) {
      // EAGAIN: none left.  Any other failure but a connection that went
      // away or a signal (no descriptor or memory left) would leave the
      // listener readable, and the loop busy, while it lasts.
      if (errno == ECONNABORTED || errno == EINTR) continue;
      if (errno != EAGAIN && errno != EWOULDBLOCK) StopAccepting(errno);
      return;
    }
    starved_ = false;
    std::string who;
    if (!Allowed(fd.get(), &who)) {
      const std::string refusal = ErrorLine(
          "permission denied: " + who + " may not connect (" +
          (options_.group_allowed ? "root and the daemon's group only" : "root only") + ")");
      (void)!send(fd.get(), refusal.data(), refusal.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
      syslog(LOG_WARNING, "refused a client: %s", who.c_str());
      continue;
    }
    // Beyond the cap the descriptor limit would be reached, which leaves
    // none for the directories of a walk: a client is told, and let go.
    if (clients_.size() >= options_.max_clients) {
      const std::string refusal =
          ErrorLine("too many clients: the daemon serves at most " +
                    std::to_string(options_.max_clients) + " at once; try again later");
      (void)!send(fd.get(), refusal.data(), refusal.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
      ++refused_;
      if (!full_) {
        full_ = true;
        syslog(LOG_WARNING, "at the client limit: serving %zu clients, refusing others",
               clients_.size());
      }
      continue;
    }
    clients_.emplace_back();
    Client& client = clients_.back();
    client.fd = std::move(fd);
    client.who = who;
    client.self = std::prev(clients_.end());
    struct epoll_event event = {};
    event.events = client.interest = EPOLLIN;
    event.data.ptr = &client;
    if (epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, client.fd.get(), &event) != 0) Drop(client);
  }
}

bool Server::Allowed(int fd, std::string* who) const {
  struct ucred peer = {};
  socklen_t size = sizeof(peer);
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0) {
    *who = "a peer of unknown credentials";
    return false;
  }
  *who = "uid " + std::to_string(peer.uid) + " (pid " + std::to_string(peer.pid) + ")";
  if (peer.uid == 0) return true;
  if (!options_.group_allowed) return false;
  if (peer.gid == options_.group) return true;
  // The supplementary groups of the peer's user.
  struct passwd entry, *found = nullptr;
  std::vector<char> buffer(16384);
  if (getpwuid_r(peer.uid, &entry, buffer.data(), buffer.size(), &found) != 0 || !found) {
    return false;
  }
  std::vector<gid_t> groups(64);
  int count = static_cast<int>(groups.size());
  if (getgrouplist(found->pw_name, peer.gid, groups.data(), &count) < 0) {
    groups.resize(static_cast<size_t>(count));
    if (getgrouplist(found->pw_name, peer.gid, groups.data(), &count) < 0) return false;
  }
  for (int i = 0; i < count; ++i) {
    if (groups[static_cast<size_t>(i)] == options_.group) return true;
  }
  return false;
}

void Server::Read(Client& client) {
  // Read on when the client has taken its replies.
  if (client.closing || client.sent_all || !Room(client)) return;
  char buffer[16384];
  const ssize_t n = recv(client.fd.get(), buffer, sizeof(buffer), MSG_DONTWAIT);
  if (n < 0 && errno != EAGAIN && errno != EINTR) {
    client.fd.Reset();  // gone: dropped by the caller
    return;
  }
  if (n == 0) client.sent_all = true;  // its requests are all in
  if (n > 0) client.in.append(buffer, static_cast<size_t>(n));
  Answer(client);
  Touch(client);
}

void Server::Answer(Client& client) {
  // Requests are answered while the client has room for the replies, so a
  // client that sends without reading cannot make the daemon's memory grow.
  size_t start = 0;
  for (size_t end;
       !client.closing && Room(client) && (end = client.in.find('\n', start)) != std::string::npos;
       start = end + 1) {
    Request(client, client.in.substr(start, end - start));
  }
  client.in.erase(0, start);
  if (client.in.size() > kMaxRequest && client.in.find('\n') == std::string::npos) {
    client.out += ErrorLine("request line longer than " + std::to_string(kMaxRequest) + " bytes");
    client.closing = true;
  }
  Fill(client);
}

bool Server::Room(const Client& client) const {
  return client.out.size() - client.sent < options_.client_buffer;
}

void Server::Request(Client& client, const std::string& line) {
  Json::Value request;
  if (!ParseRequest(line, &request)) {
    client.out += ErrorLine("a request is one JSON object on one line");
    return;
  }
  const Json::Value kind = request.get("request", Json::Value());
  if (kind == "status") {
    client.out += "{\"reply\":\"status\",";
    AppendJsonField(&client.out, "run", run_id_);
    client.out += ',';
    AppendJsonField(&client.out, "journal", logs_.journal_id());
    client.out += ',';
    AppendJsonNumber(&client.out, "clients", clients_.size());
    client.out += ',';
    AppendJsonNumber(&client.out, "max_clients", options_.max_clients);
    client.out += "," + status_() + "}\n";
    return;
  }
  if (kind != "subscribe") {
    client.out += ErrorLine("unknown request: say \"subscribe\" or \"status\"");
    return;
  }
  Subscription subscription;
  const Json::Value& name = request["queue"];
  const Json::Value& type = request["type"];
  const Json::Value& file = request["file"];
  const Json::Value& since = request["since"];
  std::string error;
  if (!name.isString()) {
    error = "\"queue\" must be the queue's name, a string";
  } else if (!type.isNull() && (!type.isString() ||
                                !zorvcommon::ParseQueueType(type.asString(), &subscription.type))) {
    error = "\"type\" must be \"share\", \"etc\" or \"local-etc\"";
  } else if (!file.isNull() && !file.isString()) {
    error = "\"file\" must be a string";
  } else if (!since.isNull() && !since.isUInt64()) {
    error = "\"since\" must be a sequence number";
  }
  if (!error.empty()) {
    client.out += ErrorLine(error);
    return;
  }
  subscription.name = name.asString();
  subscription.has_type = !type.isNull();
  subscription.has_file = !file.isNull();
  if (subscription.has_file) subscription.file = file.asString();
  // The same subscription again adds nothing; a new one must fit the
  // client's bounds.
  const bool known = std::any_of(
      client.subscriptions.begin(), client.subscriptions.end(), [&](const Subscription& held) {
        return held.name == subscription.name && held.has_type == subscription.has_type &&
               (!held.has_type || held.type == subscription.type) &&
               held.has_file == subscription.has_file && held.file == subscription.file;
      });
  const size_t bytes = subscription.name.size() + subscription.file.size();
  if (!known) {
    if (client.subscriptions.size() >= kMaxSubscriptions ||
        bytes > kMaxSubscriptionBytes - client.subscription_bytes) {
      client.out += ErrorLine("a client may hold at most " + std::to_string(kMaxSubscriptions) +
                              " subscriptions and " + std::to_string(kMaxSubscriptionBytes) +
                              " bytes of names");
      return;
    }
    client.subscriptions.push_back(subscription);
    client.subscription_bytes += bytes;
  }
  std::string reply;
  Subscribe(client, subscription, !since.isNull(), since.isNull() ? 0 : since.asUInt64(), &reply);
  client.out += reply;
}

void Server::Subscribe(Client& client, const Subscription& subscription, bool has_since,
                       uint64_t since, std::string* reply) {
  *reply = "{\"reply\":\"subscribe\",";
  AppendJsonField(reply, "run", run_id_);
  *reply += ',';
  AppendJsonField(reply, "journal", logs_.journal_id());
  *reply += ',';
  AppendJsonBytesField(reply, "queue", subscription.name);
  *reply += ",\"queues\":[";
  bool first = true;
  for (QueueLog* log :
       logs_.Find(subscription.name, subscription.has_type ? &subscription.type : nullptr,
                  subscription.has_file ? &subscription.file : nullptr)) {
    if (!first) *reply += ',';
    first = false;
    *reply += '{';
    AppendJsonField(reply, "type", zorvcommon::QueueTypeName(log->type()));
    *reply += ',';
    AppendJsonBytesField(reply, "file", log->file());
    *reply += ',';
    AppendJsonNumber(reply, "seq", log->last_seq());
    *reply += '}';
    // From after |since| (a number beyond the last record comes from
    // another journal: everything kept), or from now on.
    const uint64_t after = !has_since ? log->last_seq() : since > log->last_seq() ? 0 : since;
    const auto known = client.next.find(log);
    if (known == client.next.end()) {
      Follow(client, log, after + 1);
    } else if (has_since) {
      known->second = after + 1;
    }
    client.behind = true;
  }
  *reply += "]}\n";
}

void Server::FollowNew(const std::vector<QueueLog*>& created) {
  for (Client& client : clients_) {
    // A reload may have added notices to the logs it follows.
    client.behind = true;
    Touch(client);
    for (QueueLog* log : created) {
      for (const Subscription& subscription : client.subscriptions) {
        if (log->name() != subscription.name ||
            (subscription.has_type && log->type() != subscription.type) ||
            (subscription.has_file && log->file() != subscription.file) ||
            client.next.count(log) != 0) {
          continue;
        }
        Follow(client, log, 1);
        client.behind = true;
      }
    }
  }
}

void Server::Fill(Client& client) {
  while (client.out.size() - client.sent < options_.client_buffer) {
    // The oldest undelivered record among the followed queues.
    QueueLog* best = nullptr;
    uint64_t best_order = 0;
    for (auto& [log, next] : client.next) {
      if (next > log->last_seq()) continue;
      if (next < log->first_seq()) {
        // Before the records in memory: from the journal, a stretch at a
        // time.
        std::deque<JournalRecord>& read = client.read[log];
        while (!read.empty() && read.front().seq < next) read.pop_front();
        if (read.empty()) log->ReadJournal(next, kJournalRead, &read);
        const uint64_t kept =
            read.empty() ? log->first_seq() : std::min(read.front().seq, log->first_seq());
        // Numbers never given to a record are passed over without a word.
        next = std::min(log->Given(next), kept);
        if (next < kept) {
          // Records no longer kept are gone: say how many.
          client.out += log->head();
          AppendJsonNumber(&client.out, "missed", kept - next);
          client.out += "}\n";
          next = kept;
        }
        if (next >= log->first_seq()) client.read.erase(log);
      }
      const uint64_t order =
          next < log->first_seq() ? client.read[log].front().order : log->at(next).order;
      if (best == nullptr || order < best_order) {
        best = log;
        best_order = order;
      }
    }
    if (best == nullptr) {
      client.behind = false;
      return;
    }
    uint64_t& next = client.next[best];
    if (next < best->first_seq()) {
      std::deque<JournalRecord>& read = client.read[best];
      client.out += read.front().line;
      read.pop_front();
    } else {
      client.out += best->at(next).line;
    }
    ++next;
  }
  client.behind = true;
}

void Server::Recorded(QueueLog* log) {
  // Beyond this much waiting output, a client's socket is written at once.
  constexpr size_t kWriteAt = 16 * 1024;
  const auto range = followers_.equal_range(log);
  for (auto it = range.first; it != range.second; ++it) {
    Client& client = *it->second;
    if (client.behind || client.closing) continue;
    uint64_t& next = client.next[log];
    // A full buffer goes to the socket first, if it takes it.
    if (client.out.size() - client.sent >= options_.client_buffer && !Write(client)) {
      client.closing = true;
      continue;
    }
    if (next != log->last_seq() || client.out.size() - client.sent >= options_.client_buffer) {
      client.behind = true;
      Touch(client);
      continue;
    }
    client.out += log->at(next++).line;
    Touch(client);
    if (client.out.size() - client.sent >= std::min(kWriteAt, options_.client_buffer) &&
        !Write(client)) {
      client.closing = true;
    }
  }
}

void Server::Follow(Client& client, QueueLog* log, uint64_t next) {
  client.next[log] = next;
  ++log->followers;
  followers_.emplace(log, &client);
}

bool Server::Write(Client& client) {
  // Nothing reaches a client before its journal holds it.
  logs_.BeforeSend();
  while (client.sent < client.out.size()) {
    const ssize_t n = send(client.fd.get(), client.out.data() + client.sent,
                           client.out.size() - client.sent, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && errno == EAGAIN) break;
    if (n <= 0) return false;
    client.sent += static_cast<size_t>(n);
  }
  if (client.sent == client.out.size()) {
    client.out.clear();
    client.sent = 0;
    return !client.closing;
  }
  if (client.sent > client.out.size() / 2) {
    client.out.erase(0, client.sent);
    client.sent = 0;
  }
  return true;
}

bool Server::Flush(Client& client) {
  for (;;) {
    if (client.in.find('\n') != std::string::npos) Answer(client);  // requests that waited for room
    Fill(client);
    if (!Write(client)) return false;
    // Done when the socket takes no more (poll says when it does) or the
    // client has every record.
    if (client.sent < client.out.size() || !client.behind) return true;
  }
}

void Server::Deliver() {
  std::vector<Client*> dirty;
  dirty.swap(dirty_);
  for (Client* client : dirty) {
    client->dirty = false;
    if (!Flush(*client)) {
      Drop(*client);
      continue;
    }
    Watch(*client);
  }
}

void Server::Drop(Client& client) {
  for (auto& [log, next] : client.next) {
    const auto range = followers_.equal_range(log);
    for (auto it = range.first; it != range.second; ++it) {
      if (it->second == &client) {
        followers_.erase(it);
        break;
      }
    }
    logs_.Unfollow(log);
  }
  client.read.clear();
  if (client.dirty) dirty_.erase(std::find(dirty_.begin(), dirty_.end(), &client));
  clients_.erase(client.self);  // closing the descriptor takes it out of epoll
  // Its descriptor is free again.
  ResumeAccepting();
  if (full_ && clients_.size() < options_.max_clients) {
    full_ = false;
    syslog(LOG_NOTICE, "accepting clients again: %zu were refused at the client limit", refused_);
    refused_ = 0;
  }
}

}  // namespace zorvnotifyd
