#include "platform/threads/Transactions.h"

#include "platform/base/Immortal.h"

#include <iterator>
#include <map>
#include <string_view>
#include <utility>

namespace ost::platform {

Transactions& Transactions::shared() {
    static Immortal transactions([] { return Transactions(); });
    return *transactions;
}

bool Transactions::waitUntilNone(std::chrono::steady_clock::time_point deadline) {
    MutexLock lock(_mutex);
    return _noneLeft.waitUntil(lock, deadline, [this]() OST_REQUIRES(_mutex) { return _names.empty(); });
}

std::string Transactions::describeOpen() {
    const MutexLock lock(_mutex);
    std::map<std::string_view, std::size_t> counts;
    for (const auto& name : _names)
        ++counts[name];
    std::string description;
    for (const auto& [name, count] : counts) {
        description.append(description.empty() ? "" : ", ").append(name);
        if (count > 1)
            description.append(" (" + std::to_string(count) + ")");
    }
    return description;
}

Transactions::Names::iterator Transactions::_open(std::string name) {
    Names opened;
    opened.push_back(std::move(name));
    const MutexLock lock(_mutex);
    _names.splice(_names.end(), opened);
    return std::prev(_names.end());
}

void Transactions::_end(Names::iterator transaction) {
    Names ended;
    const MutexLock lock(_mutex);
    ended.splice(ended.end(), _names, transaction);
    if (_names.empty())
        _noneLeft.notifyAll();
}

Transaction::Transaction(std::string name) : _transaction(Transactions::shared()._open(std::move(name))) {}

Transaction& Transaction::operator=(Transaction&& other) noexcept {
    if (this != &other) {
        end();
        _transaction = std::exchange(other._transaction, {});
    }
    return *this;
}

void Transaction::end() noexcept {
    if (const auto transaction = std::exchange(_transaction, {}))
        Transactions::shared()._end(*transaction);
}

} // namespace ost::platform

namespace ost {

namespace {

/// Work with its transaction, which is declared first so that it outlives everything the work holds.
struct TransactedWork {
    platform::Transaction transaction;
    platform::WorkQueue::Work work;

    void operator()() { work(); }
};

} // namespace

void async_with_transaction(platform::WorkQueue& queue, platform::WorkQueue::Work work) {
    queue.async(TransactedWork{platform::Transaction(queue.label()), std::move(work)});
}

} // namespace ost
