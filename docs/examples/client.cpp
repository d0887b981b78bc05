// A client of the container daemon: makes a container, counts its starts in an info value, and lists what there is,
// once at once and once more when its standard input ends, however often the daemon has ended in between.
//
//     c++ -std=c++23 client.cpp $(pkg-config --cflags --libs ostrand) -o client
//     chmod 700 client # who may execute it has its rights
//     ostrandctl sign client --identifier com.example.client --entitlement com.tamarok.private.Ostrand.allowed
//     ./client /var/lib/ostrand/device

#include <ostrand/ostrand.h>

#include <cstdlib>
#include <iostream>
#include <limits>

using namespace ostrand::v1;

namespace {

/// The value of a result; without one, says why and ends.
template<typename T>
T valueOf(Result<T> result) {
    if (!result) {
        std::cerr << "client: " << result.error().description() << '\n';
        std::exit(1);
    }
    if constexpr (!std::is_void_v<T>)
        return *std::move(result);
}

void countStart(Client& client, const ContainerReference& container) {
    const auto before = client.infoValue(container, "starts");
    const auto* const count = before ? std::get_if<std::uint64_t>(&before->of) : nullptr;
    const std::uint64_t now = count ? *count + 1 : 1;
    valueOf(client.setInfoValue(container, "starts", Value{now}));
    std::cout << "start " << now << " of " << container.identifier << '\n';
}

void showContainers(Client& client) {
    for (const auto& [identifier, uuid] : valueOf(client.list(ContainerClass::dataApplication)))
        std::cout << uuid << "  " << identifier << std::endl;
}

} // namespace

int main(int argc, char** argv) {
    Client client({.device = argc > 1 ? argv[1] : "/", .timeout = std::chrono::seconds(10)});
    const auto made = valueOf(client.create({.containerClass = ContainerClass::dataApplication}));
    countStart(client, {.identifier = made.identifier, .uuid = made.uuid});
    showContainers(client);
    std::cin.ignore(std::numeric_limits<std::streamsize>::max());
    showContainers(client);
}
