// User-level trace probes (USDT) of the provider `axd`.
//
// Each probe has a semaphore that the kernel raises while a tracer is attached, so the arguments of
// a probe (descriptions of whole messages, say) are computed only then:
//
//   AXD_TRACE(request__input, pid, description.c_str());            // cheap arguments
//   if (AXD_TRACE_ENABLED(request__output))                          // costly arguments
//       AXD_TRACE(request__output, pid, reply.description().c_str());
//
// A hyphen of a probe's name is written as a double underscore ("request-input" is
// request__input). Every probe is declared here and its semaphore defined in Trace.cpp; docs/tracing.md
// lists them and shows how to attach bpftrace or stap.
#pragma once

#define _SDT_HAS_SEMAPHORES 1
#define SDT_USE_VARIADIC 1
#include <sys/sdt.h>

#define AXD_PROBES(X)    \
    X(client__new)       \
    X(client__done)      \
    X(request)           \
    X(request__input)    \
    X(request__output)   \
    X(plugin__add)       \
    X(plugin__remove)    \
    X(plugin__ready)     \
    X(db__load)          \
    X(discover__raw)

#define AXD_DECLARE_SEMAPHORE(name) extern "C" unsigned short axd_##name##_semaphore;
AXD_PROBES(AXD_DECLARE_SEMAPHORE)
#undef AXD_DECLARE_SEMAPHORE

// True while a tracer listens on the probe.
#define AXD_TRACE_ENABLED(name) __builtin_expect(axd_##name##_semaphore != 0, 0)

// Fires the probe when a tracer listens; the arguments are not evaluated otherwise.
#define AXD_TRACE(name, ...)                                   \
    do {                                                       \
        if (AXD_TRACE_ENABLED(name)) STAP_PROBEV(axd, name, ##__VA_ARGS__); \
    } while (0)
