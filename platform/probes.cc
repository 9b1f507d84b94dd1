#include "platform/probes.h"

// The semaphores live in the ".probes" section, where tracers expect them;
// a tracer adds 1 to a probe's semaphore while it is attached to that probe.
#define DR_PROBE_SEMAPHORE(name) \
  __attribute__((section(".probes"), used)) volatile unsigned short name = 0

extern "C" {
DR_PROBE_SEMAPHORE(drd_client__new_semaphore);
DR_PROBE_SEMAPHORE(drd_client__done_semaphore);
DR_PROBE_SEMAPHORE(drd_request_semaphore);
DR_PROBE_SEMAPHORE(drd_request__input_semaphore);
DR_PROBE_SEMAPHORE(drd_request__output_semaphore);
DR_PROBE_SEMAPHORE(drd_db__load_semaphore);
DR_PROBE_SEMAPHORE(drd_discover__raw_semaphore);
DR_PROBE_SEMAPHORE(drd_plugin__add_semaphore);
DR_PROBE_SEMAPHORE(drd_plugin__remove_semaphore);
DR_PROBE_SEMAPHORE(drd_plugin__ready_semaphore);
}
