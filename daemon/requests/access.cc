// Read access to plug-in bundles: tokens, and opening them.
#include <cerrno>

#include "core/format.h"
#include "daemon/ipc_client.h"
#include "daemon/requests/requests.h"
#include "platform/file_system.h"
#include "store/extension_issuing.h"
#include "wire/protocol.h"

namespace dr::requests {

using namespace message;

void accessPlugIns(Transaction& t, DRDatabase& database, Sandbox* sandbox) {
  Array tokens;
  bool walked = t.processUuidList(database, [&](const DRDPlugInPtr& p) {
    const std::string path = p->path().value_or("");
    // The bundle as registered: a folder swapped for a link since then is
    // refused (EACCES), not followed to wherever the link points.
    Result<std::string> token = issueReadExtensionForURL(sandbox, path, path);
    if (!token.ok()) {
      t.failMessage(kErrorMalformed, Format("cannot create extension to %@: %d", path,
                                            static_cast<int>(token.error().code())));
      return false;
    }
    tokens.emplace_back(std::move(token).value());
    return true;
  });
  if (!walked) return;
  t.setReplyValue(kExtensionsKey, Value(std::move(tokens)));
  t.done();
}

// A sandboxed host cannot reach a plug-in's files by path: it hands drd the
// token and gets the granted file or folder back as a descriptor. Only the
// token's signature is checked: whatever the registry says now, the token
// grants what it names, and the path is opened without following any link,
// so a folder swapped for a link since is refused.
void openExtension(Transaction& t, Sandbox* sandbox) {
  const Value& token = t.request()[kTokenKey];
  if (!token.isString()) {
    t.failMessage(kErrorMalformed, "invalid request format (token)");
    return;
  }
  Result<std::string> path = sandbox ? sandbox->grantedPath(token.stringValue())
                                     : Result<std::string>(PosixError(ENOKEY, "no sandbox"));
  if (!path.ok()) {
    t.log("client %d: token refused: %@", t.client()->pid(), path.error().localizedDescription());
    t.failMessage(kErrorNotPermitted, "token refused");
    return;
  }
  Result<UniqueFd> fd = OpenForReading(*path);
  if (!fd.ok()) {
    const int64_t code = fd.error().domain() == kPosixErrorDomain ? fd.error().code() : EIO;
    t.failMessage(kErrorBadPath, Format("cannot open %@: %d", *path, static_cast<int>(code)));
    return;
  }
  t.setReplyValue(kPathKey, Value(*path));
  t.attachDescriptor(std::move(*fd));
  t.done();
}

}  // namespace dr::requests
