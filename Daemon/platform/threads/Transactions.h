#pragma once

#include "platform/base/Mutex.h"
#include "platform/threads/WorkQueue.h"

#include <chrono>
#include <list>
#include <optional>
#include <string>
#include <utility>

namespace ost::platform {

/// The process's open transactions: pieces of work under way that keep the daemon from being idle. An end of the
/// process waits for them.
///
/// Threads: any.
class Transactions {
public:
    static Transactions& shared();

    /// Waits until no transaction is open, at most until `deadline`. False when some are open still.
    [[nodiscard]] bool waitUntilNone(std::chrono::steady_clock::time_point deadline);

    /// The names of the open transactions, as `name, name (2)`.
    [[nodiscard]] std::string describeOpen();

private:
    friend class Transaction;
    using Names = std::list<std::string>;

    [[nodiscard]] Names::iterator _open(std::string name);
    void _end(Names::iterator transaction);

    Mutex _mutex;
    Names _names OST_GUARDED_BY(_mutex);
    Condition _noneLeft;
};

/// One open transaction; ends when destroyed. Move-only. One object belongs to one thread at a time.
class Transaction {
public:
    /// Opens a transaction. `name` says, in an error line, what kept the daemon busy.
    explicit Transaction(std::string name);
    Transaction(Transaction&& other) noexcept : _transaction(std::exchange(other._transaction, {})) {}
    Transaction& operator=(Transaction&& other) noexcept;
    Transaction(const Transaction&) = delete;
    Transaction& operator=(const Transaction&) = delete;
    ~Transaction() { end(); }

    /// Ends the transaction early. Does nothing when it has ended.
    void end() noexcept;

private:
    std::optional<Transactions::Names::iterator> _transaction;
};

} // namespace ost::platform

namespace ost {

/// Opens a transaction and enqueues `work` on `queue`; the transaction ends when the work has run, or when the queue
/// drops it.
void async_with_transaction(platform::WorkQueue& queue, platform::WorkQueue::Work work);

} // namespace ost
