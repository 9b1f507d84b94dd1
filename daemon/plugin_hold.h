// DRDPlugInHold: a set of plug-ins kept out of use until the hold is released
// by its token or its client's connection dies.
//
// Immutable once made; safe to read from any thread. While a hold exists the
// process holds one keep-alive transaction, so the daemon is not stopped as
// idle. The server's hold list owns holds; a hold refers to its client weakly.
#pragma once

#include <memory>
#include <set>
#include <vector>

#include "core/value.h"
#include "plugin/plugin.h"

namespace dr {

class DRDIpcClient;

class DRDPlugInHold {
 public:
  // A hold with a fresh random token over `plugIns` (duplicates collapse),
  // placed by `client`.
  static std::shared_ptr<DRDPlugInHold> initWithPlugInsForClient(
      const std::vector<DRDPlugInPtr>& plugIns, const std::shared_ptr<DRDIpcClient>& client);
  ~DRDPlugInHold();
  DRDPlugInHold(const DRDPlugInHold&) = delete;
  DRDPlugInHold& operator=(const DRDPlugInHold&) = delete;

  const Uuid& uuid() const { return uuid_; }
  // The held plug-ins, one per UUID, in the order first given.
  const std::vector<DRDPlugInPtr>& blocked() const { return blocked_; }
  // Whether `plugIn` (or any record equal to it) is held.
  bool blocks(const DRDPlugIn& plugIn) const;
  // Whether `client` is the very client that placed the hold.
  bool placedBy(const DRDIpcClient* client) const;
  std::shared_ptr<DRDIpcClient> client() const { return client_.lock(); }

  // Holds are equal when their tokens are.
  bool operator==(const DRDPlugInHold& other) const { return uuid_ == other.uuid_; }

 private:
  DRDPlugInHold() = default;

  Uuid uuid_;
  std::vector<DRDPlugInPtr> blocked_;
  std::set<Uuid> blockedUuids_;
  std::weak_ptr<DRDIpcClient> client_;
  const DRDIpcClient* clientIdentity_ = nullptr;
};

// The hold list as request handlers use it; DRDServer keeps the one list.
// REQUIRES (all three): not on the server's "serverSync" queue.
class PlugInHolds {
 public:
  // Whether some hold in force blocks `plugIn`.
  virtual bool holdOnPlugIn(const DRDPlugIn& plugIn) = 0;
  // Puts `hold` in force.
  virtual void addHold(std::shared_ptr<DRDPlugInHold> hold) = 0;
  // Releases the hold with `token`, if any.
  virtual void unholdToken(const Uuid& token) = 0;

 protected:
  ~PlugInHolds() = default;
};

}  // namespace dr
