// drd's trace probes: USDT probes of provider "drd", free until a tracer
// (bpftrace, perf, SystemTap) attaches.
//
//   client-new      int pid
//   client-done     int pid
//   request         int pid, char* request name (may be null)
//   request-input   int pid, char* message text
//   request-output  int pid, char* reply text
//   db-load         char* error domain, uint64_t error code
//   discover-raw    unsigned int count
//   plugin-add      char* path
//   plugin-remove   char* path, bool resolved
//   plugin-ready    char* UUID text
//
// The names above, with their '-', are what the notes carry and what tracing
// scripts name. Every probe has a semaphore, raised by a tracer while it is
// attached; request-input and request-output are given text that is costly
// to make, so their callers build it only when ...Enabled() says so. No
// state; any thread.
#pragma once

#include <cstdint>

// Semaphores, one per probe; defined in probes.cc.
extern "C" {
extern volatile unsigned short drd_client__new_semaphore;
extern volatile unsigned short drd_client__done_semaphore;
extern volatile unsigned short drd_request_semaphore;
extern volatile unsigned short drd_request__input_semaphore;
extern volatile unsigned short drd_request__output_semaphore;
extern volatile unsigned short drd_db__load_semaphore;
extern volatile unsigned short drd_discover__raw_semaphore;
extern volatile unsigned short drd_plugin__add_semaphore;
extern volatile unsigned short drd_plugin__remove_semaphore;
extern volatile unsigned short drd_plugin__ready_semaphore;
}

#define _SDT_HAS_SEMAPHORES 1
#include <sys/sdt.h>

// <sys/sdt.h> writes a probe's name into its note as the C identifier it is
// given, so "client-new" would read "client__new". For the duration of this
// header the note strings are instead looked up in the table below, keyed by
// that identifier, so the notes carry the documented names; the identifiers
// still name the semaphores.
#pragma push_macro("_SDT_ASM_STRING")
#undef _SDT_ASM_STRING
#define _SDT_ASM_STRING(x) _SDT_ASM_1(.asciz DR_PROBE_NOTE_##x)
#define DR_PROBE_NOTE_drd "drd"
#define DR_PROBE_NOTE_client__new "client-new"
#define DR_PROBE_NOTE_client__done "client-done"
#define DR_PROBE_NOTE_request "request"
#define DR_PROBE_NOTE_request__input "request-input"
#define DR_PROBE_NOTE_request__output "request-output"
#define DR_PROBE_NOTE_db__load "db-load"
#define DR_PROBE_NOTE_discover__raw "discover-raw"
#define DR_PROBE_NOTE_plugin__add "plugin-add"
#define DR_PROBE_NOTE_plugin__remove "plugin-remove"
#define DR_PROBE_NOTE_plugin__ready "plugin-ready"

namespace dr::probes {

inline void ClientNew(int pid) { STAP_PROBE1(drd, client__new, pid); }
inline void ClientDone(int pid) { STAP_PROBE1(drd, client__done, pid); }
inline void Request(int pid, const char* requestName) {
  STAP_PROBE2(drd, request, pid, requestName);
}
inline bool RequestInputEnabled() { return __builtin_expect(drd_request__input_semaphore != 0, 0); }
inline void RequestInput(int pid, const char* messageText) {
  STAP_PROBE2(drd, request__input, pid, messageText);
}
inline bool RequestOutputEnabled() {
  return __builtin_expect(drd_request__output_semaphore != 0, 0);
}
inline void RequestOutput(int pid, const char* replyText) {
  STAP_PROBE2(drd, request__output, pid, replyText);
}
inline void DbLoad(const char* errorDomain, uint64_t errorCode) {
  STAP_PROBE2(drd, db__load, errorDomain, errorCode);
}
inline void DiscoverRaw(unsigned int count) { STAP_PROBE1(drd, discover__raw, count); }
inline void PluginAdd(const char* path) { STAP_PROBE1(drd, plugin__add, path); }
inline void PluginRemove(const char* path, bool resolved) {
  STAP_PROBE2(drd, plugin__remove, path, resolved);
}
inline void PluginReady(const char* uuidText) { STAP_PROBE1(drd, plugin__ready, uuidText); }

}  // namespace dr::probes

#undef DR_PROBE_NOTE_drd
#undef DR_PROBE_NOTE_client__new
#undef DR_PROBE_NOTE_client__done
#undef DR_PROBE_NOTE_request
#undef DR_PROBE_NOTE_request__input
#undef DR_PROBE_NOTE_request__output
#undef DR_PROBE_NOTE_db__load
#undef DR_PROBE_NOTE_discover__raw
#undef DR_PROBE_NOTE_plugin__add
#undef DR_PROBE_NOTE_plugin__remove
#undef DR_PROBE_NOTE_plugin__ready
#pragma pop_macro("_SDT_ASM_STRING")
