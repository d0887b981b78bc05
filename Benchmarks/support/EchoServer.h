#pragma once

#include "Support/ChildProcess.h"
#include "platform/base/FileDescriptor.h"

#include <cstddef>
#include <string>

namespace ost::benchmarks {

/// The bare work of a daemon that answers: a process with an event loop, as many threads as there are processors, each
/// of which serves what it receives, edge-triggered. Every `requestSize` bytes are answered with the same reply.
class EchoServer {
public:
    EchoServer(const std::string& socketPath, std::size_t requestSize, std::string reply);

private:
    platform::FileDescriptor _listener;
    test::ChildProcess _process;
};

} // namespace ost::benchmarks
