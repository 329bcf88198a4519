#pragma once
// The daemon's static trace probes, provider "qmd" (USDT, visible to bpftrace,
// perf and `readelf -n`). Every probe is declared here; each fires where its
// request is served. A hyphen in a probe's name is written "__".
// They cost a no-op instruction until a tracer enables them.

#include <sys/sdt.h>

#define QM_PROBE_REQ_ADD() DTRACE_PROBE(qmd, req__add)
#define QM_PROBE_REQ_REMOVE() DTRACE_PROBE(qmd, req__remove)
#define QM_PROBE_REQ_BULK() DTRACE_PROBE(qmd, req__bulk)
#define QM_PROBE_REQ_HOLDDOWN() DTRACE_PROBE(qmd, req__holddown)
#define QM_PROBE_REQ_MATCH() DTRACE_PROBE(qmd, req__match)
#define QM_PROBE_REQ_READY() DTRACE_PROBE(qmd, req__ready)
#define QM_PROBE_REQ_ACCESS() DTRACE_PROBE(qmd, req__access)
#define QM_PROBE_REQ_ANNOTATE() DTRACE_PROBE(qmd, req__annotate)
// path: const char*
#define QM_PROBE_PLUGIN_ADD(path) DTRACE_PROBE1(qmd, plugin__add, path)
// path: const char*, resolved: int (boolean)
#define QM_PROBE_PLUGIN_REMOVE(path, resolved) DTRACE_PROBE2(qmd, plugin__remove, path, resolved)
// uuid: const char* (canonical text)
#define QM_PROBE_PLUGIN_READY(uuid) DTRACE_PROBE1(qmd, plugin__ready, uuid)
// domain: const char*, code: uint64_t
#define QM_PROBE_DB_LOAD(domain, code) DTRACE_PROBE2(qmd, db__load, domain, code)
