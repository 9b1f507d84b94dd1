#include "daemon/plugin_hold.h"

#include "platform/message_service.h"

namespace dr {

std::shared_ptr<DRDPlugInHold> DRDPlugInHold::initWithPlugInsForClient(
    const std::vector<DRDPlugInPtr>& plugIns, const std::shared_ptr<DRDIpcClient>& client) {
  std::shared_ptr<DRDPlugInHold> hold(new DRDPlugInHold());
  hold->uuid_ = Uuid::random();
  for (const DRDPlugInPtr& plugIn : plugIns) {
    if (!plugIn || !plugIn->uuid()) continue;
    if (hold->blockedUuids_.insert(*plugIn->uuid()).second) hold->blocked_.push_back(plugIn);
  }
  hold->client_ = client;
  hold->clientIdentity_ = client.get();
  KeepAliveBegin();
  return hold;
}

DRDPlugInHold::~DRDPlugInHold() { KeepAliveEnd(); }

bool DRDPlugInHold::blocks(const DRDPlugIn& plugIn) const {
  return plugIn.uuid() && blockedUuids_.count(*plugIn.uuid()) != 0;
}

bool DRDPlugInHold::placedBy(const DRDIpcClient* client) const {
  // Identity: the pointer alone would match a new client at the address of a
  // gone one, so the weak reference must still lead to it.
  return client && clientIdentity_ == client && client_.lock().get() == client;
}

}  // namespace dr
