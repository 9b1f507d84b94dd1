// The request handlers: one function per request drd serves, grouped by
// family, one file per family. Each is handed its transaction (the request,
// its client, its reply) and the parts of the server it uses, nothing more;
// the request table (transaction.cc) lists the requests and hands them out.
// Each handler answers exactly once through the transaction, a failure as an
// error reply. REQUIRES: on the server's service queue.
#pragma once

#include "daemon/plugin_hold.h"
#include "daemon/transaction.h"
#include "platform/policy.h"
#include "platform/sandbox.h"
#include "store/database.h"
#include "store/user_prefs.h"

namespace dr::requests {

// "add" and "remove" register and unregister the bundles at "paths";
// "bulk" is accepted and ignored (registry.cc).
void addPlugIns(Transaction& t, DRDatabase& database);
void removePlugIns(Transaction& t, DRDatabase& database);
void bulkPlugIns(Transaction& t);

// "match": the installed plug-ins the client is offered (match.cc). The
// sandbox tells whether the client may ask for every plug-in; the policy
// (none: nothing vetoed) and the user's exclusions filter what is offered.
void matchPlugIns(Transaction& t, DRDatabase& database, PlugInHolds& holds, DRDUserPrefs& prefs,
                  Sandbox* sandbox, Policy* policy);

// "ready": enables the plug-ins of "uuids" for the client (ready.cc).
void readyPlugIns(Transaction& t, DRDatabase& database, PlugInHolds& holds);

// "access": a read token per plug-in of "uuids"; "open": the file a token
// grants, as a descriptor (access.cc).
void accessPlugIns(Transaction& t, DRDatabase& database, Sandbox* sandbox);
void openExtension(Transaction& t, Sandbox* sandbox);

// "annotate": records the user's choices for the plug-ins of "uuids"
// (annotate.cc).
void annotatePlugIns(Transaction& t, DRDatabase& database);

// "lock": places a hold on the plug-ins "paths" name, or releases the holds
// of "uuids" (lock.cc).
void lockDownPlugIns(Transaction& t, DRDatabase& database, PlugInHolds& holds);

}  // namespace dr::requests
