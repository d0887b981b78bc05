#pragma once

namespace ost::benchmarks {

/// Moves this process into a mount namespace of its own, with fresh memory for scratch files, and runs the program
/// again as a copy there that only root may execute and that is signed to ask the daemon for everything. Returns in
/// that copy. Whatever is mounted and written from then on is gone with the last process, however the benchmark ends.
void enterWorkshop(char** arguments);

} // namespace ost::benchmarks
