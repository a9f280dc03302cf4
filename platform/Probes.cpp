// Semaphores of the "omd" probes. They live in the .probes section, where USDT tracers expect them,
// and are raised by a tracer while it has the probe enabled.
#include "platform/Probes.h"

#define OM_PROBE_SEMAPHORE(probe) unsigned short omd_##probe##_semaphore __attribute__((section(".probes"))) = 0

extern "C" {
OM_PROBE_SEMAPHORE(client__new);
OM_PROBE_SEMAPHORE(client__done);
OM_PROBE_SEMAPHORE(request__input);
OM_PROBE_SEMAPHORE(request);
OM_PROBE_SEMAPHORE(request__output);
OM_PROBE_SEMAPHORE(discover__raw);
OM_PROBE_SEMAPHORE(plugin__add);
OM_PROBE_SEMAPHORE(plugin__remove);
OM_PROBE_SEMAPHORE(plugin__ready);
OM_PROBE_SEMAPHORE(db__load);
}
