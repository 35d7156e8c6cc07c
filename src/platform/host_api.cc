// The exported C entry points: each forwards to its entry in the table in
// force. Both the tables and the entry points come from QUVAHOST_OPS.
#include "host_ops.h"

namespace quvahost {
namespace {

// constexpr so that g_host_ops is constant-initialized: usable from any static
// initializer, whatever the order of initialization.
constexpr HostOps kRealHostOps = {
#define QUVAHOST_OP_REAL(prefix, name, result, params, args) name##Impl,
    QUVAHOST_OPS(QUVAHOST_OP_REAL)
#undef QUVAHOST_OP_REAL
};

HostOps g_host_ops = kRealHostOps;

}  // namespace

HostOps SetHostOps(const HostOps* ops) {
  HostOps previous = g_host_ops;
  const HostOps& chosen = ops != nullptr ? *ops : kRealHostOps;
#define QUVAHOST_OP_SET(prefix, name, result, params, args) \
  g_host_ops.name = chosen.name != nullptr ? chosen.name : kRealHostOps.name;
  QUVAHOST_OPS(QUVAHOST_OP_SET)
#undef QUVAHOST_OP_SET
  return previous;
}

}  // namespace quvahost

extern "C" {

// A definition whose type differs from the declaration in quvahost.h is a
// conflicting declaration of a C function: the compiler rejects it.
#define QUVAHOST_OP_FORWARD(prefix, name, result, params, args) \
  result prefix##name params { return quvahost::g_host_ops.name args; }
QUVAHOST_OPS(QUVAHOST_OP_FORWARD)
#undef QUVAHOST_OP_FORWARD

}  // extern "C"
