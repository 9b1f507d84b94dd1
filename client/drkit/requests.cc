// The verbs that send requests to drd.
#include <errno.h>
#include <poll.h>
#include <signal.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <iterator>
#include <memory>

#include "client/drkit/commands.h"
#include "client/drkit/output.h"
#include "client/include/drd/client.h"

namespace dr::drkit {
namespace {

using client::Client;
using client::PlugIn;

// Every copy of an identifier the user may have annotated: all versions,
// duplicates and hybrids, as drd offers them to drkit.
constexpr uint64_t kEveryCopy =
    client::kDiscoverAllVersions | client::kDiscoverDuplicates | client::kDiscoverHybrid;

Result<std::unique_ptr<Client>> Connect(const Invocation& inv) {
  return Client::Open(inv.service, client::DefaultSocketDirectory());
}

std::vector<Uuid> ParseUuids(const std::vector<std::string>& texts) {
  std::vector<Uuid> out;
  for (const std::string& t : texts) out.push_back(*Uuid::parse(t));  // checked when parsed
  return out;
}

// The installed copies of `identifier` that drd offers; an error when none.
Result<std::vector<PlugIn>> CopiesOf(Client& c, const std::string& identifier) {
  Result<std::vector<PlugIn>> found =
      c.match(Value{{client::kRuleIdentifier, identifier}}, kEveryCopy);
  if (found.ok() && found->empty()) {
    return Error(kUsageErrorDomain, 1, "no plug-in with identifier '" + identifier + "'");
  }
  return found;
}

// add and remove: `change` of the bundles at the operands' paths.
int ChangeBundles(const Invocation& inv, Io& io,
                  Status (Client::*change)(const std::vector<std::string>&)) {
  std::vector<std::string> paths;
  for (const std::string& p : inv.operands) paths.push_back(AbsolutePath(p));
  auto c = Connect(inv);
  Status s = c.ok() ? ((**c).*change)(paths) : c.status();
  return s.ok() ? 0 : Fail(io, s.error());
}

}  // namespace

std::string AbsolutePath(const std::string& path) {
  std::filesystem::path p(path);
  if (p.is_relative()) {
    std::error_code ec;
    p = std::filesystem::current_path(ec) / p;
  }
  std::string out = p.lexically_normal().string();
  while (out.size() > 1 && out.back() == '/') out.pop_back();
  return out;
}

std::string Json(const Io& io, const Value& value) { return ToJson(value, io.prettyJson); }

int Fail(Io& io, const Error& error) {
  Fail(io, DescribeError(error));
  if (error.domain() == kPosixErrorDomain &&
      (error.code() == ENOENT || error.code() == ECONNREFUSED)) {
    io.err << "drkit: drd is not running; start it with 'systemctl --user start drd.socket'"
              " (or run 'drd' in another terminal)\n";
  }
  return 1;
}

int Fail(Io& io, const std::string& message) {
  io.err << "drkit: " << message << "\n";
  return 1;
}

int RunMatch(const Invocation& inv, Io& io) {
  auto c = Connect(inv);
  if (!c.ok()) return Fail(io, c.error());
  Result<std::vector<PlugIn>> found = (*c)->match(inv.rules, inv.flags);
  if (!found.ok()) return Fail(io, found.error());
  if (inv.json) {
    Array forms;
    for (const PlugIn& p : *found) forms.push_back(p.form);
    io.out << Json(io, Value(std::move(forms))) << "\n";
    return 0;
  }
  // People read the list by identifier; copies of one identifier keep drd's
  // order.
  std::stable_sort(found->begin(), found->end(),
                   [](const PlugIn& a, const PlugIn& b) { return a.identifier < b.identifier; });
  for (const PlugIn& p : *found) io.out << PlugInLines(p, inv.verbose);
  return 0;
}

int RunAdd(const Invocation& inv, Io& io) { return ChangeBundles(inv, io, &Client::addPlugIns); }

int RunRemove(const Invocation& inv, Io& io) {
  return ChangeBundles(inv, io, &Client::removePlugIns);
}

int RunElect(const Invocation& inv, Io& io) {
  const std::string& choice = inv.operands[0];
  client::AnnotationChange change;
  change.election = choice == "use"      ? client::kElectionUse
                    : choice == "ignore" ? client::kElectionIgnore
                                         : client::kElectionDefault;
  auto c = Connect(inv);
  if (!c.ok()) return Fail(io, c.error());
  Result<std::vector<PlugIn>> copies = CopiesOf(**c, inv.identifier);
  if (!copies.ok()) return Fail(io, copies.error());
  std::vector<Uuid> uuids;
  for (const PlugIn& p : *copies) uuids.push_back(p.uuid);
  Status s = (*c)->annotate(uuids, change);
  return s.ok() ? 0 : Fail(io, s.error());
}

int RunAnnotate(const Invocation& inv, Io& io) {
  auto c = Connect(inv);
  if (!c.ok()) return Fail(io, c.error());
  Result<std::vector<PlugIn>> copies = CopiesOf(**c, inv.identifier);
  if (!copies.ok()) return Fail(io, copies.error());
  if (inv.operands.empty() && inv.unset.empty()) {
    const Value& settings = copies->front().settings();
    io.out << Json(io, settings.isDictionary() ? settings : Value::EmptyDictionary()) << "\n";
    return 0;
  }
  // drd replaces the settings dictionary as a whole, so each copy's own
  // settings are changed here and sent back complete.
  for (const PlugIn& p : *copies) {
    Dictionary settings = p.settings().dictionary();
    for (const std::string& pair : inv.operands) {
      size_t eq = pair.find('=');
      settings[pair.substr(0, eq)] = Value(pair.substr(eq + 1));
    }
    for (const std::string& key : inv.unset) settings.erase(key);
    client::AnnotationChange change;
    change.settings = Value(std::move(settings));
    if (Status s = (*c)->annotate({p.uuid}, change); !s.ok()) return Fail(io, s.error());
  }
  return 0;
}

int RunHold(const Invocation& inv, Io& io) {
  std::vector<std::string> paths;
  for (const std::string& p : inv.operands) paths.push_back(AbsolutePath(p));
  // Blocked before the hold exists, so that a signal arriving at any point
  // after it is seen by signalfd and ends drkit cleanly.
  sigset_t stop;
  sigemptyset(&stop);
  sigaddset(&stop, SIGINT);
  sigaddset(&stop, SIGTERM);
  sigaddset(&stop, SIGHUP);
  sigprocmask(SIG_BLOCK, &stop, nullptr);
  int signals = ::signalfd(-1, &stop, SFD_CLOEXEC);
  if (signals < 0) return Fail(io, PosixError(errno, "signalfd"));

  auto c = Connect(inv);
  if (!c.ok()) return Fail(io, c.error());
  std::vector<Value> conflicts;
  Result<Uuid> token = (*c)->hold(*inv.holdTarget, paths, &conflicts);
  if (!token.ok()) {
    int status = Fail(io, token.error());
    for (const Value& busy : conflicts) io.err << "drkit: busy: " << busy.description() << "\n";
    ::close(signals);
    return status;
  }
  if (inv.json) {
    io.out << Json(io, Value{{"token", token->string()}}) << std::endl;
  } else {
    io.out << token->string() << std::endl;
  }

  // Kept until a signal comes or standard input ends, or drd goes away: the
  // hold lives in drd, so a drkit that stayed would hold nothing.
  char buffer[4096];
  bool stdinOpen = true;
  const int connection = (*c)->connection().descriptor();
  for (;;) {
    struct pollfd fds[3] = {
        {signals, POLLIN, 0}, {connection, POLLIN | POLLRDHUP, 0}, {STDIN_FILENO, POLLIN, 0}};
    int ready = ::poll(fds, stdinOpen ? 3 : 2, -1);
    if (ready < 0 && errno == EINTR) continue;
    if (ready < 0 || (fds[0].revents & POLLIN)) break;
    if (fds[1].revents) {
      ::close(signals);
      io.err << "drkit: drd closed the connection; the hold is gone\n";
      return 1;
    }
    if (stdinOpen && fds[2].revents) {
      if (fds[2].revents & POLLNVAL) {
        stdinOpen = false;  // no standard input at all: wait for a signal
        continue;
      }
      ssize_t n = ::read(STDIN_FILENO, buffer, sizeof buffer);
      if (n == 0 || (n < 0 && errno != EINTR && errno != EAGAIN)) break;
    }
  }
  ::close(signals);
  // Closing the connection would release the hold too; releasing it first
  // says so in drd's log.
  (*c)->release({*token});
  return 0;
}

int RunRelease(const Invocation& inv, Io& io) {
  auto c = Connect(inv);
  Status s = c.ok() ? (*c)->release(ParseUuids(inv.operands)) : c.status();
  return s.ok() ? 0 : Fail(io, s.error());
}

int RunReady(const Invocation& inv, Io& io) {
  auto c = Connect(inv);
  Status s = c.ok() ? (*c)->ready(ParseUuids(inv.operands)) : c.status();
  return s.ok() ? 0 : Fail(io, s.error());
}

int RunAccess(const Invocation& inv, Io& io) {
  auto c = Connect(inv);
  if (!c.ok()) return Fail(io, c.error());
  const std::vector<Uuid> uuids = ParseUuids(inv.operands);
  Result<std::vector<std::string>> tokens = (*c)->access(uuids);
  if (!tokens.ok()) return Fail(io, tokens.error());
  if (inv.json) {
    Array pairs;
    for (size_t i = 0; i < tokens->size() && i < uuids.size(); ++i) {
      pairs.push_back(Value{{"uuid", uuids[i].string()}, {"token", (*tokens)[i]}});
    }
    io.out << Json(io, Value(std::move(pairs))) << "\n";
    return 0;
  }
  for (const std::string& t : *tokens) io.out << t << "\n";
  return 0;
}

int RunRaw(const Invocation& inv, Io& io) {
  std::string text;
  if (inv.operands.empty()) {
    text.assign(std::istreambuf_iterator<char>(io.in), std::istreambuf_iterator<char>());
  } else {
    text = inv.operands[0];
  }
  Result<Value> message = FromJson(text);
  if (!message.ok()) {
    io.err << "drkit: raw: " << message.error().localizedDescription() << "\n";
    return kExitUsage;
  }
  if (!message->isDictionary()) {
    io.err << "drkit: raw: the request must be a JSON object\n";
    return kExitUsage;
  }
  auto c = Connect(inv);
  if (!c.ok()) return Fail(io, c.error());
  Result<Value> reply = (*c)->send(*message);
  if (!reply.ok()) return Fail(io, reply.error());
  io.out << Json(io, *reply) << "\n";
  if (Status status = client::ReplyStatus(*reply); !status.ok()) return Fail(io, status.error());
  return 0;
}

int RunStatus(const Invocation& inv, Io& io) {
  const std::string directory = client::DefaultSocketDirectory();
  auto c = Client::Open(inv.service, directory);
  // An empty annotation changes nothing and is answered at once: a request
  // that proves drd serves, without side effects.
  Status s = c.ok() ? (*c)->annotate({}, client::AnnotationChange{}) : c.status();
  const std::string socket = directory + "/" + inv.service;
  if (inv.json) {
    io.out << Json(io, Value{{"service", inv.service}, {"socket", socket}, {"answering", s.ok()}})
           << "\n";
  } else {
    io.out << "service: " << inv.service << "\n"
           << "socket: " << socket << "\n"
           << "state: " << (s.ok() ? "answering" : "not answering") << "\n";
  }
  return s.ok() ? 0 : Fail(io, s.error());
}

}  // namespace dr::drkit
