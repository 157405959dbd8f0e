// Inside the location broker: what its database, its service and its client
// side share. Private to src/platform/ncs/broker.
#ifndef NCS_BROKER_BROKER_H
#define NCS_BROKER_BROKER_H

#include "ncs/lb.h"
#include "ncs/lb_format.h"

#include <asio.hpp>

#include <chrono>
#include <climits>
#include <cstddef>
#include <optional>
#include <string>

namespace ncs::lb {

// Positions are serial numbers of registrations; a walk position is signed.
constexpr uint32_t kMaxSerial = INT32_MAX;

// "interface <uuid> at <host>:<port>", for traces.
std::string describe(const lb__entry_t &entry);

// Registers (or with kUnregister removes) `entry` with the broker running in
// this process, in the name of the process itself; nullopt when no broker
// runs here.
std::optional<uint32_t> update_embedded(Kind kind, const lb__entry_t &entry);

}  // namespace ncs::lb

#endif
