// The socket paths that the typed index requests connect to, replaceable by
// tests so that a test daemon need not own the fixed paths under /tmp. Not
// exported; production code never calls the setter.
#ifndef QUVAIDX_REQUESTS_INDEX_REQUESTS_INTERNAL_H_
#define QUVAIDX_REQUESTS_INDEX_REQUESTS_INTERNAL_H_

namespace quvaidx {

struct IndexSockets {
  const char* media_parser;  // QUVAIDX_MEDIA_PARSER_SOCKET by default
  const char* plugin;        // QUVAIDX_PLUGIN_SOCKET by default
};

// Installs `sockets` (whose texts must outlive their use) and returns the
// previous pair. A null member restores its default (the seam convention of
// util/hooks.h). Not synchronised: call it while no typed request runs.
IndexSockets SetIndexSockets(IndexSockets sockets);

}  // namespace quvaidx

#endif  // QUVAIDX_REQUESTS_INDEX_REQUESTS_INTERNAL_H_
