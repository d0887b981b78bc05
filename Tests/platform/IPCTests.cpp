#include "platform/base/Log.h"
#include "platform/ipc/IPCListener.h"
#include "platform/threads/BlockingSection.h"

#include "Support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <filesystem>
#include <functional>
#include <latch>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace {

/// With what the next `send` of a service fails; 0: it does not.
std::atomic<int> nextSendError{0};

} // namespace

/// Stands before the C library's for this whole program. Services are those that never wait.
extern "C" ssize_t send(int socket, const void* bytes, size_t size, int flags) {
    if ((flags & MSG_DONTWAIT) != 0)
        if (const int error = nextSendError.exchange(0); error != 0) {
            errno = error;
            return -1;
        }
    return ::sendto(socket, bytes, size, flags, nullptr, 0);
}

namespace ost::platform {
namespace {

using namespace std::chrono_literals;
using Connection = std::shared_ptr<IPCConnection>;

// What the test service does for the "Command" of a request.
enum Command : std::uint64_t {
    echo,     ///< replies with the request's number "Value"
    keep,     ///< keeps its reply until a `release`
    release,  ///< sends the replies kept, last first, then its own
    refuse,   ///< cancels the connection
    silence,  ///< gives no reply
    wait,     ///< replies once the service's gate is open, waiting in a blocking section
    stand,    ///< the same, keeping the user's turn
    hold,     ///< the same, keeping the thread
    openGate, ///< opens the gate
    fill,     ///< replies with as many bytes as "Value" says
    fail,     ///< throws
};

/// A listener at a socket with a name of the kernel's choice, and its handler.
class Service {
public:
    explicit Service(const IPCLimits& limits = {}) {
        FileDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        _address.sun_family = AF_UNIX;
        EXPECT_EQ(::bind(socket.get(), reinterpret_cast<sockaddr*>(&_address), sizeof _address.sun_family), 0);
        EXPECT_EQ(::listen(socket.get(), SOMAXCONN), 0);
        _addressSize = sizeof _address;
        EXPECT_EQ(::getsockname(socket.get(), reinterpret_cast<sockaddr*>(&_address), &_addressSize), 0);
        auto made = IPCListener::create(
            std::move(socket), "test.listener",
            [this](const Connection& connection) {
                connection->setMessageHandler(
                    [this](const auto& sender, IPCRequest request) { _handle(sender, request); });
                connection->setInvalidationHandler([this](const auto&) { _count(invalidated); });
                connection->resume();
            },
            _forUnsignedClients(limits));
        EXPECT_TRUE(made && (*made)->resume());
        listener = *std::move(made);
    }
    ~Service() { gate.count_down(gate.try_wait() ? 0 : 1); }

    [[nodiscard]] const sockaddr* address() const { return reinterpret_cast<const sockaddr*>(&_address); }
    [[nodiscard]] socklen_t addressSize() const { return _addressSize; }

    /// Waits until a counter has reached a value.
    static void await(const std::atomic<int>& counter, int value) {
        for (int now = counter; now < value; now = counter)
            counter.wait(now);
    }

    std::atomic<int> handled{0};
    std::atomic<int> waiting{0};
    std::atomic<int> invalidated{0};
    std::latch gate{1};
    std::unique_ptr<IPCListener> listener;

private:
    /// The clients are this process, which is not signed.
    static IPCLimits _forUnsignedClients(IPCLimits limits) {
        limits.payloadWithoutEntitlements = limits.payload;
        return limits;
    }

    static void _count(std::atomic<int>& counter) {
        ++counter;
        counter.notify_all();
    }

    void _handle(const Connection& connection, IPCRequest& request) {
        const auto value = request.unsignedValue("Value");
        const auto command = request.unsignedValue("Command");
        auto reply = command == refuse || command == silence ? std::nullopt : connection->createReply(request);
        _count(handled);
        switch (command) {
        case keep:
            return _keep(*std::move(reply));
        case release:
            _releaseKept();
            break;
        case refuse:
            return connection->cancel();
        case silence:
            return;
        case wait:
            _wait(BlockingSection::Turn::giveAway);
            break;
        case stand:
            _wait(BlockingSection::Turn::keep);
            break;
        case hold:
            _count(waiting);
            gate.wait();
            break;
        case openGate:
            gate.count_down();
            break;
        case fill:
            reply->set("Filling", std::string(value, 'x'));
            break;
        case fail:
            throw std::runtime_error("a fault of the handler");
        default:
            break;
        }
        EXPECT_FALSE(connection->createReply(request)) << "one request, one reply";
        reply->set("Value", value);
        reply->send();
    }

    void _wait(BlockingSection::Turn turn) {
        const BlockingSection section(turn);
        _count(waiting);
        gate.wait();
    }

    void _keep(IPCReply reply) {
        const std::lock_guard lock(_mutex);
        _kept.push_back(std::move(reply));
    }

    void _releaseKept() {
        const std::lock_guard lock(_mutex);
        for (; !_kept.empty(); _kept.pop_back())
            _kept.back().send();
    }

    sockaddr_un _address{};
    socklen_t _addressSize = 0;
    std::mutex _mutex;
    std::vector<IPCReply> _kept;
};

std::string request(std::uint32_t number, std::uint64_t command, std::uint64_t value = 0, std::size_t padding = 0) {
    std::string frame(IPCFrameHeader::size, '\0');
    CBOREncoder encoder(frame);
    encoder.beginMap(3);
    encoder.key("Command"), encoder.unsignedNumber(command);
    encoder.key("Value"), encoder.unsignedNumber(value);
    encoder.key("Padding"), encoder.data(std::string(padding, 'p'));
    IPCFrameHeader{static_cast<std::uint32_t>(frame.size() - IPCFrameHeader::size), number}.write(frame.data());
    return frame;
}

class Client {
public:
    explicit Client(const Service& service) : Client() { connect(service); }
    Client() : _socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        // Nothing waits for so long; a test that would hang fails instead.
        const timeval patience{.tv_sec = 60, .tv_usec = 0};
        ::setsockopt(_socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    }

    void connect(const Service& service) {
        ASSERT_EQ(::connect(_socket.get(), service.address(), service.addressSize()), 0);
    }
    void connectAs(uid_t user, const Service& service) {
        // Credentials are the thread's.
        std::thread([&] {
            ASSERT_EQ(::syscall(SYS_setresuid, -1, user, -1), 0);
            connect(service);
        }).join();
    }

    /// False when the service has closed the connection.
    bool send(std::string_view bytes) {
        while (!bytes.empty()) {
            const auto sent = ::send(_socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
            if (sent < 0)
                return false;
            bytes.remove_prefix(static_cast<std::size_t>(sent));
        }
        return true;
    }
    void sendEnd() { ::shutdown(_socket.get(), SHUT_WR); }
    void close() { _socket.reset(); }

    /// The next reply; absent at the end of the connection.
    std::optional<IPCFrame> receive() {
        for (;;) {
            if (auto frame = _reader.next())
                return *std::move(frame);
            const auto space = _reader.space(_scratch);
            const auto count = ::recv(_socket.get(), space.data(), space.size(), 0);
            EXPECT_GE(count, 0) << "errno " << errno;
            if (count <= 0)
                return std::nullopt;
            _reader.received(static_cast<std::size_t>(count));
        }
    }

    /// The number of the next reply, none at the end of the connection.
    std::optional<std::uint32_t> receiveNumber() {
        const auto frame = receive();
        return frame ? std::optional(frame->requestNumber()) : std::nullopt;
    }

private:
    FileDescriptor _socket;
    IPCFrameReader _reader;
    std::vector<char> _scratch = std::vector<char>(4096);
};

std::ptrdiff_t threadsOfThisProcess() {
    return std::distance(std::filesystem::directory_iterator("/proc/self/task"), {});
}

rlim_t highestDescriptor() {
    rlim_t highest = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd"))
        highest = std::max<rlim_t>(highest, std::stoul(entry.path().filename()));
    return highest;
}

TEST(IPC, AnswersPipelinedRequestsInOrderHoweverTheyArriveCut) {
    constexpr std::uint32_t requests = 3000;
    std::string stream;
    for (std::uint32_t number = 0; number < requests; ++number)
        stream += request(number, echo, number * 3, number % 500 == 7 ? 100'000 : number % 50);
    const Service service;
    for (const std::size_t cut : {std::size_t{7}, std::size_t{1021}, std::size_t{65'536}, stream.size()}) {
        Client client(service);
        std::thread sender([&] {
            for (std::size_t at = 0; at < stream.size(); at += cut)
                client.send(std::string_view(stream).substr(at, cut));
            client.sendEnd();
        });
        for (std::uint32_t number = 0; number < requests; ++number) {
            const auto reply = client.receive();
            ASSERT_TRUE(reply);
            ASSERT_EQ(reply->requestNumber(), number);
            ASSERT_EQ(validateCBOR(reply->payload())->find("Value")->asUnsigned(), number * 3);
        }
        EXPECT_FALSE(client.receive()) << "a client that has sent its last gets its replies and the end";
        sender.join();
    }
}

TEST(IPC, AMalformedFrameEndsTheConnectionBehindTheEarlierReplies) {
    const auto frame = [](std::uint32_t length, std::string payload) {
        std::string bytes(IPCFrameHeader::size, '\0');
        IPCFrameHeader{length, 2}.write(bytes.data());
        return bytes + payload;
    };
    const std::string cases[] = {
        frame(0, ""),     frame(IPCFrameHeader::maximumPayload + 1, ""), frame(0xffffffff, ""),
        frame(1, "\x80"), frame(2, std::string("\xa0\x00", 2)),          frame(7, "\xa2\x61\x6b\x01\x61\x6b\x02"),
    };
    for (const auto& bad : cases) {
        Service service;
        Client client(service);
        client.send(request(1, echo) + bad + request(3, echo));
        EXPECT_EQ(client.receiveNumber(), 1);
        EXPECT_EQ(client.receiveNumber(), std::nullopt);
        Service::await(service.invalidated, 1);
        EXPECT_EQ(service.handled, 1);
        service.listener.reset();
        EXPECT_EQ(service.invalidated, 1) << "the end is told once";
    }
}

TEST(IPC, CancelDropsTheRequestAtHandAndThoseBehindIt) {
    Service service;
    Client client(service), other(service);
    // The last reply but two is still to come when the connection is cancelled; it belongs to an earlier request.
    client.send(request(1, echo) + request(2, keep) + request(3, refuse) + request(4, echo));
    EXPECT_EQ(client.receiveNumber(), 1);
    Service::await(service.handled, 3);
    other.send(request(1, release));
    EXPECT_EQ(client.receiveNumber(), 2);
    EXPECT_EQ(client.receiveNumber(), std::nullopt);
    EXPECT_EQ(other.receiveNumber(), 1);
    Service::await(service.invalidated, 1);
    EXPECT_EQ(service.handled, 4);
    EXPECT_FALSE(client.send(request(5, echo)));
}

TEST(IPC, RepliesMayComeLaterAndOutliveTheirClient) {
    Service service;
    Client client(service), gone(service), other(service);
    client.send(request(1, keep) + request(2, keep) + request(3, echo));
    EXPECT_EQ(client.receiveNumber(), 3);
    gone.send(request(1, keep) + request(2, silence));
    Service::await(service.handled, 5);
    gone.close();
    Service::await(service.invalidated, 1);
    client.sendEnd();
    other.send(request(1, release));
    EXPECT_EQ(client.receiveNumber(), 2);
    EXPECT_EQ(client.receiveNumber(), 1);
    EXPECT_EQ(client.receiveNumber(), std::nullopt);

    other.send(request(2, keep));
    Service::await(service.handled, 7);
    service.listener.reset(); // what is kept outlives the listener, and is then neither sent nor a fault
    EXPECT_EQ(other.receiveNumber(), 1);
    EXPECT_EQ(other.receiveNumber(), std::nullopt);
}

TEST(IPC, RequestsOfAClientThatHasGoneAreStillHandled) {
    Service service;
    {
        Client client(service);
        client.send(request(1, echo) + request(2, echo) + request(3, silence));
    }
    Service::await(service.invalidated, 1);
    EXPECT_EQ(service.handled, 3);
}

TEST(IPC, AFaultOfTheHandlerEndsOneConnection) {
    const Service service;
    Client client(service), other(service);
    client.send(request(1, fail));
    EXPECT_EQ(client.receiveNumber(), std::nullopt);
    other.send(request(1, echo));
    EXPECT_EQ(other.receiveNumber(), 1);
}

TEST(IPC, IdleAndStalledClientsCostNoThreads) {
    const Service service;
    std::vector<Client> clients(1000);
    const auto half = request(1, echo).substr(0, 11);
    for (auto& client : clients) {
        client.connect(service);
        client.send(half);
    }
    const auto before = threadsOfThisProcess();
    Client other(service);
    other.send(request(1, echo));
    EXPECT_EQ(other.receiveNumber(), 1);
    EXPECT_EQ(threadsOfThisProcess(), before);
    // One for each processor, that for root, this one, and one of a sanitizer's.
    EXPECT_LE(before, static_cast<std::ptrdiff_t>(std::max(2U, std::thread::hardware_concurrency())) + 3);
    clients[500].send(request(1, echo).substr(11));
    EXPECT_EQ(clients[500].receiveNumber(), 1);
}

TEST(IPC, RequestsThatWaitKeepNobodyFromBeingServed) {
    constexpr int waiters = 100;
    Service service;
    std::vector<Client> clients(waiters);
    for (auto& client : clients) {
        client.connectAs(501, service);
        client.send(request(1, wait));
    }
    Service::await(service.waiting, waiters);
    Client other(service);
    other.send(request(1, echo) + request(2, openGate));
    EXPECT_EQ(other.receiveNumber(), 1);
    EXPECT_EQ(other.receiveNumber(), 2);
    for (auto& client : clients)
        EXPECT_EQ(client.receiveNumber(), 1);
}

TEST(IPC, AUserStandsBeforeOthersWithFewRequestsAtATime) {
    Service service({.turnsOfOneUser = 2});
    std::vector<Client> clients(16);
    for (auto& client : clients) {
        client.connectAs(501, service);
        client.send(request(1, stand) + request(2, echo));
    }
    Client other;
    other.connectAs(502, service);
    for (std::uint32_t number = 1; number <= 100; ++number) {
        other.send(request(number, echo));
        EXPECT_EQ(other.receiveNumber(), number);
    }
    Service::await(service.waiting, 2);
    EXPECT_EQ(service.waiting, 2);
    other.send(request(1, openGate));
    for (auto& client : clients) {
        EXPECT_EQ(client.receiveNumber(), 1);
        EXPECT_EQ(client.receiveNumber(), 2);
    }
}

TEST(IPC, OneThreadIsLeftForRootHoweverManyUsersTakeTheirs) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "Only root can connect for others";
    const unsigned threads = std::max(2U, std::thread::hardware_concurrency());
    Service service;
    std::vector<Client> holding(2 * std::size_t{threads});
    for (std::size_t index = 0; index < holding.size(); ++index) {
        holding[index].connectAs(static_cast<uid_t>(600 + index / 2), service);
        holding[index].send(request(1, hold));
    }
    Service::await(service.waiting, static_cast<int>(threads));
    Client root(service);
    root.send(request(1, echo) + request(2, openGate));
    EXPECT_EQ(root.receiveNumber(), 1U);
    EXPECT_EQ(root.receiveNumber(), 2U);
    for (auto& client : holding)
        EXPECT_EQ(client.receiveNumber(), 1U);
}

TEST(IPC, ClientsWithoutEndLeaveOthersTheirTurn) {
    const Service service;
    std::atomic<bool> done{false};
    std::string flood;
    for (std::uint32_t number = 0; number < 1000; ++number)
        flood += request(number, silence);
    std::vector<std::thread> floods;
    for (unsigned i = 0; i < 2 * std::max(2U, std::thread::hardware_concurrency()); ++i)
        floods.emplace_back([&] {
            Client client(service);
            while (!done)
                client.send(flood);
        });
    Client client(service);
    for (std::uint32_t number = 0; number < 50; ++number) {
        client.send(request(number, echo));
        EXPECT_EQ(client.receiveNumber(), number);
    }
    done = true;
    for (auto& thread : floods)
        thread.join();
}

TEST(IPC, AReplyThatTheSocketCannotHoldComesWhole) {
    const Service service;
    Client client(service);
    constexpr std::size_t size = 8 * 1024 * 1024;
    client.send(request(1, fill, size) + request(2, fill, 100) + request(3, fill, size));
    for (std::uint32_t number = 1; number <= 3; ++number) {
        const auto reply = client.receive();
        ASSERT_TRUE(reply);
        EXPECT_EQ(reply->requestNumber(), number);
        ASSERT_TRUE(validateCBOR(reply->payload()));
        if (number % 2 == 1) {
            EXPECT_EQ(validateCBOR(reply->payload())->find("Filling")->asText()->size(), size);
        }
    }
}

TEST(IPC, AReplyForWhichTheKernelHasNoMemoryComesLater) {
    const Service service;
    Client client(service);
    std::uint32_t number = 0;
    for (const int error : {ENOBUFS, ENOMEM}) {
        nextSendError = error;
        client.send(request(++number, echo));
        ASSERT_EQ(client.receiveNumber(), number);
        EXPECT_EQ(nextSendError, 0) << "it failed";
    }
}

TEST(IPC, AClientThatPassesALimitLosesItsConnection) {
    constexpr std::size_t large = 4 * 1024 * 1024;
    const struct {
        const char* what;
        IPCLimits limits;
        std::string sent;
    } cases[] = {
        {"a frame that does not arrive", {.completeFrame = 20ms}, request(1, echo).substr(0, 20)},
        {"a header that does not arrive", {.completeFrame = 20ms}, request(1, echo).substr(0, 1)},
        {"a reply that is not taken", {.takeReply = 20ms}, request(1, fill, large)},
        {"replies after a cancel that are not taken",
         {.takeReply = 20ms},
         request(1, fill, large) + request(2, refuse)},
        {"too many replies unread",
         {.unreadReplies = 2 * large},
         request(1, fill, large) + request(2, fill, large) + request(3, fill, large)},
        {"a frame over the limit", {.payload = 1000}, request(1, echo, 0, 1000)},
        {"a reply over the limit", {.payload = 1000}, request(1, fill, 1000)},
    };
    for (const auto& [what, limits, sent] : cases) {
        SCOPED_TRACE(what);
        Service service(limits);
        Client client(service);
        client.send(sent);
        Service::await(service.invalidated, 1);
    }
}

TEST(IPC, TheLargestConsumerOfAUserThatTakesTooMuchMemoryGoes) {
    constexpr std::size_t kilobyte = 1024;
    Service service({.memoryOfOneUser = 1000 * kilobyte, .memoryOfUsers = 1500 * kilobyte});
    // All but the last byte of a frame.
    const auto begin = [&](Client& client, uid_t user, std::size_t kilobytes) {
        client.connectAs(user, service);
        const auto whole = request(1, echo, 0, kilobytes * kilobyte);
        client.send(whole.substr(0, whole.size() - 1));
    };
    Client root, small, large, middle;
    begin(root, 0, 4000);
    begin(small, 501, 200);
    begin(large, 501, 700);
    begin(middle, 501, 300);
    Service::await(service.invalidated, 1);
    EXPECT_EQ(large.receiveNumber(), std::nullopt) << "its user takes more than one may";

    Client otherUser, thirdUser;
    begin(otherUser, 502, 900);
    begin(thirdUser, 503, 300);
    Service::await(service.invalidated, 2);
    EXPECT_EQ(otherUser.receiveNumber(), std::nullopt) << "users take more than they may together";

    Client reader;
    reader.connectAs(501, service);
    for (std::uint32_t number = 1; number <= 8; ++number)
        reader.send(request(number, fill, 200 * kilobyte));
    Service::await(service.invalidated, 3);

    for (Client* const client : {&root, &small, &middle, &thirdUser}) {
        client->send("p");
        EXPECT_EQ(client->receiveNumber(), 1);
    }
}

TEST(IPC, AClientWithoutDebtsMayStay) {
    Service service({.takeReply = 20ms, .completeFrame = 20ms});
    Client stays(service), late(service);
    stays.send(request(1, echo));
    late.send(request(1, echo) + request(2, echo).substr(0, 5));
    // The one that owes half a frame goes, the one that owes nothing stays, though both have been here as long.
    Service::await(service.invalidated, 1);
    EXPECT_EQ(late.receiveNumber(), 1);
    EXPECT_EQ(late.receiveNumber(), std::nullopt);
    EXPECT_EQ(stays.receiveNumber(), 1);
    stays.send(request(2, echo));
    EXPECT_EQ(stays.receiveNumber(), 2);
}

TEST(IPC, WhereThereIsNoRoomAnIdleConnectionOfTheUserWithTheMostLeaves) {
    Service service({.connections = 5, .connectionsKeptForRoot = 3, .connectionsOfOneUser = 1});
    const auto isServed = [](Client& client) {
        client.send(request(1, echo));
        return client.receiveNumber() == 1;
    };
    std::vector<Client> clients(9);
    const auto connectAs = [&](uid_t user, std::size_t client) {
        clients[client].connectAs(user, service);
        return isServed(clients[client]);
    };
    EXPECT_TRUE(connectAs(501, 0));
    EXPECT_FALSE(connectAs(501, 1)) << "it has one";
    EXPECT_TRUE(connectAs(502, 2));
    EXPECT_TRUE(connectAs(503, 3)) << "the one that is idle for the longest makes room";
    EXPECT_EQ(clients[0].receiveNumber(), std::nullopt);
    EXPECT_TRUE(connectAs(0, 4) && connectAs(0, 5) && connectAs(0, 6));
    EXPECT_TRUE(isServed(clients[4]));
    EXPECT_TRUE(connectAs(504, 7)) << "root's do not make room for users";
    EXPECT_EQ(clients[2].receiveNumber(), std::nullopt);
    EXPECT_TRUE(connectAs(0, 8));
    EXPECT_EQ(clients[5].receiveNumber(), std::nullopt) << "root has the most";
    EXPECT_TRUE(isServed(clients[3]) && isServed(clients[4]));
}

TEST(IPC, AcceptingPausesWithoutDescriptorsAndGoesOnWhenTheyAreBack) {
    const auto log = test::makeScratchDirectory() / "log";
    ASSERT_TRUE(Log::shared().open(LogLevel::error, {.path = log, .files = 1, .size = 1 << 20}));
    const FileDescriptor lines(::open(log.c_str(), O_RDONLY | O_CLOEXEC));
    const auto logged = [&](std::string_view text) {
        std::string content(4096, '\0');
        content.resize(static_cast<std::size_t>(::pread(lines.get(), content.data(), content.size(), 0)));
        return content.find(text) != std::string::npos;
    };

    // Descriptors come back with a connection that goes, or unseen; for the latter there is the time.
    for (const auto acceptAgain : {std::chrono::milliseconds(1h), std::chrono::milliseconds(20)}) {
        Service service({.acceptAgain = acceptAgain});
        Client present(service), waiting;
        present.send(request(1, echo));
        EXPECT_EQ(present.receiveNumber(), 1);
        rlimit all{};
        ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &all), 0);
        EXPECT_EQ(all.rlim_cur, all.rlim_max) << "the listener takes what it may";
        const rlimit few{.rlim_cur = highestDescriptor() + 8, .rlim_max = all.rlim_max};
        ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &few), 0);
        std::vector<FileDescriptor> fillers;
        do
            fillers.emplace_back(::open("/dev/null", O_RDONLY | O_CLOEXEC));
        while (fillers.back());
        waiting.connect(service);
        while (!logged("accepting pauses"))
            std::this_thread::yield();
        if (acceptAgain > 1min)
            present.close();
        else
            fillers.clear();
        waiting.send(request(1, echo));
        EXPECT_EQ(waiting.receiveNumber(), 1);
        ::setrlimit(RLIMIT_NOFILE, &all);
        ASSERT_EQ(::truncate(log.c_str(), 0), 0);
    }
}

TEST(IPC, FinishesTheRequestUnderWayAndBeginsNoOther) {
    Service service;
    Client client(service), idle(service);
    client.send(request(1, wait) + request(2, echo));
    Service::await(service.waiting, 1);
    EXPECT_FALSE(service.listener->finish(std::chrono::steady_clock::now()));
    idle.send(request(1, echo));
    service.gate.count_down();
    EXPECT_TRUE(service.listener->finish(std::chrono::steady_clock::now() + 60s));
    EXPECT_EQ(client.receiveNumber(), 1);
    service.listener.reset();
    EXPECT_EQ(client.receiveNumber(), std::nullopt);
    EXPECT_EQ(idle.receiveNumber(), std::nullopt);
    EXPECT_EQ(service.handled, 1);
    EXPECT_EQ(service.invalidated, 2);
}

} // namespace
} // namespace ost::platform
