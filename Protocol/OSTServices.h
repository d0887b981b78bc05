#pragma once

namespace ost {

/// The services of the daemon, and the names of their sockets.
inline constexpr const char* OSTServiceName = "com.tamarok.ostrandd";            ///< requests of clients
inline constexpr const char* OSTKernServiceName = "com.tamarok.ostrandd.upcall"; ///< the kernel's upcalls

/// The device's directory that holds the sockets of its services.
inline constexpr const char* OSTServiceSocketDirectory = "/private/var/run";

} // namespace ost
