// The tag of every line the server side logs (the rules, the transports, the
// storages, the leases and the program), so that one filter shows them all.
#pragma once

namespace lumivale {
namespace tessarine {
namespace server {

inline constexpr char kServerLogTag[] = "tessarine_server";

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
