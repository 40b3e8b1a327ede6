#include "platform/trace/Trace.h"

// The semaphores live in the .probes section, where tracers find and raise them.
#define AXD_DEFINE_SEMAPHORE(name) \
    __attribute__((section(".probes"), used)) unsigned short axd_##name##_semaphore = 0;
extern "C" {
AXD_PROBES(AXD_DEFINE_SEMAPHORE)
}
