// The tag of every line the store logs (its components, the MQTT transport
// and connection), so that one filter shows them all; the server's lines
// carry their own (server/ServerLog.h).
#pragma once

namespace lumivale {
namespace tessarine {

inline constexpr char kStoreLogTag[] = "tessarine";

}  // namespace tessarine
}  // namespace lumivale
