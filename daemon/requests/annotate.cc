// Recording the user's choices for plug-ins.
#include "daemon/requests/requests.h"
#include "pdoc/pdoc.h"
#include "wire/protocol.h"

namespace dr::requests {
namespace {

using namespace message;

// A number as a message carries one: an integer or a floating-point value
// (a boolean is not one).
bool IsMessageNumber(const Value& value) {
  return value.type() == Value::Type::kInt || value.type() == Value::Type::kUInt ||
         value.type() == Value::Type::kDouble;
}

}  // namespace

void annotatePlugIns(Transaction& t, DRDatabase& database) {
  const Value annotations = Transaction::DictionaryValue(t.request(), kAnnotationsKey);
  if (annotations.isAbsent()) {
    t.failMessage(kErrorMalformed, "invalid request format (bad annotations dictionary)");
    return;
  }
  Dictionary changes;
  // Values the annotation file cannot hold (a UUID, say) are refused here:
  // kept in memory they would make every later save of the file fail.
  if (const Value& election = annotations[kElectionKey]; election.isPresent()) {
    if (!IsMessageNumber(election) || !pdoc::WriteXml(election).ok()) {
      t.failMessage(kErrorMalformed, "invalid request format (annotation election)");
      return;
    }
    changes[kElectionKey] = election;
  }
  if (const Value& extension = annotations[kExtensionKey]; extension.isPresent()) {
    // In a form the settings sit two levels below it (its "annotations",
    // then this): deeper ones would make every reply that carries the
    // plug-in's form impossible to send.
    if (!extension.isDictionary() || extension.depth() > kMaxFormDepth - 2 ||
        !pdoc::WriteXml(extension).ok()) {
      t.failMessage(kErrorMalformed, "invalid request format (annotation extension)");
      return;
    }
    changes[kExtensionKey] = extension;
  }
  if (changes.empty()) {
    t.done();
    return;
  }
  const Value change(std::move(changes));
  if (t.processUuidList(database, [&](const DRDPlugInPtr& p) {
        database.setAnnotationForPlugIn(change, *p);
        return true;
      })) {
    t.done();
  }
}

}  // namespace dr::requests
