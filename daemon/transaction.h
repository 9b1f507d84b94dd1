// Transaction: one request of one client and its one reply.
//
// Made when the message arrives and run on the server's service queue by
// dispatch, which checks the envelope and runs the request's handler from the
// request table (daemon/requests/). Every request ends in exactly one reply
// (done, or a failure operation), except that a request of a client that is
// gone, or a message that asked for no reply, gets none. Failures are
// replies: "errorcode" and "error" are added to the reply, next to whatever
// the handler already put there. Holds its client strongly. REQUIRES: used on
// the service queue only.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "core/format.h"
#include "core/log.h"
#include "core/status.h"
#include "core/unique_fd.h"
#include "core/value.h"
#include "platform/message_service.h"
#include "plugin/discovery.h"
#include "plugin/plugin.h"

namespace dr {

class DRDatabase;
class DRDIpcClient;

class Transaction {
 public:
  // Called per path: the canonical path and true, or the path as given and
  // false when it cannot be resolved. False stops the walk; it must have
  // sent an error reply.
  using PathOperation = std::function<bool(const std::string& path, bool resolved)>;
  // Called per plug-in; false stops the walk and must have replied.
  using PlugInOperation = std::function<bool(const DRDPlugInPtr& plugIn)>;

  static std::shared_ptr<Transaction> initWithRequestForClient(
      PeerMessage request, std::shared_ptr<DRDIpcClient> client);

  // Checks the version and the client, then runs the handler of the request.
  void dispatch();

  // Walks "paths"; true when every path was handled.
  bool marshalPaths(const PathOperation& operation);
  // marshalPaths, then the success reply when it ran to the end.
  bool processPaths(const PathOperation& operation);
  // Walks "uuids" as plug-ins of `database`; true when every one was
  // handled. Sends no success reply.
  bool processUuidList(DRDatabase& database, const PlugInOperation& operation);

  // Sends the reply.
  void done();
  // Adds "errorcode" and "error" to the reply, then sends it.
  void failMessage(int64_t code, std::string_view message);
  // An error of drd's own domain keeps its code and description; any other
  // is sent with `code` and its localized description.
  void failError(int64_t code, const Error& error);

  const std::shared_ptr<DRDIpcClient>& client() const { return client_; }
  const Value& request() const { return request_.body; }
  // Adds `key` to the reply.
  void setReplyValue(std::string_view key, const Value& value);
  // Adds `key` to the reply with the forms of a discovery, written from
  // their records' encoded bytes.
  void setReplyForms(std::string_view key, DiscoveredForms forms);
  // Sends `fd` with the reply.
  void attachDescriptor(UniqueFd fd) { descriptors_.push_back(std::move(fd)); }

  // One line of the system log, as the server writes it: always (log), or
  // only when the server is verbose (debug).
  template <typename... Args>
  void log(std::string_view format, const Args&... args) const {
    SystemLogLine(Format(format, args...));
  }
  template <typename... Args>
  void debug(std::string_view format, const Args&... args) const {
    if (verbose_ != 0) SystemLogLine(Format(format, args...));
  }

  // The value under `key` when it is an array (a dictionary), else absent.
  static Value ArrayValue(const Value& message, std::string_view key);
  static Value DictionaryValue(const Value& message, std::string_view key);

 private:
  Transaction(PeerMessage request, std::shared_ptr<DRDIpcClient> client);
  // The reply as a value (for log lines), and as the body of its frame.
  Value replyValue() const;
  drm1::Splice replyFrame() const;

  const std::shared_ptr<DRDIpcClient> client_;
  const PeerMessage request_;
  const uint32_t verbose_;  // the server's, when the request came
  Value reply_;             // a dictionary
  std::string formsKey_;    // where forms_ go in the reply, if anywhere
  std::optional<DiscoveredForms> forms_;
  std::vector<UniqueFd> descriptors_;  // sent with the reply
  bool replied_ = false;
};

}  // namespace dr
