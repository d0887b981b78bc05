#include "platform/base/StackTrace.h"

#include <execinfo.h>

#include <array>
#include <cstdlib>
#include <memory>
#include <span>
#include <typeinfo>

namespace ost::platform {

namespace {

constexpr int depthLimit = 64; // the frames that matter are the innermost

struct Stack {
    std::array<void*, depthLimit> frames;
    int depth = 0;

    void capture() noexcept { depth = ::backtrace(frames.data(), depthLimit); }
};

thread_local Stack stackOfLastThrow;

std::vector<std::string> symbols(const Stack& stack) {
    struct Free {
        void operator()(char** text) const { std::free(text); }
    };
    const std::unique_ptr<char*, Free> texts(::backtrace_symbols(stack.frames.data(), stack.depth));
    if (!texts)
        return {};
    const std::span lines(texts.get(), static_cast<std::size_t>(stack.depth));
    return {lines.begin(), lines.end()};
}

} // namespace

std::vector<std::string> callStackSymbols() {
    Stack stack;
    stack.capture();
    return symbols(stack);
}

std::vector<std::string> exceptionCallStackSymbols() {
    return stackOfLastThrow.depth > 0 ? symbols(stackOfLastThrow) : callStackSymbols();
}

} // namespace ost::platform

// The linker's names for a wrapped symbol. Without the option nobody calls the wrapper, and the original is not needed.
extern "C" {
[[noreturn]] [[gnu::weak]] void __real___cxa_throw(void* exception, std::type_info* type, void (*destroy)(void*));
[[noreturn]] void __wrap___cxa_throw(void* exception, std::type_info* type, void (*destroy)(void*));

void __wrap___cxa_throw(void* exception, std::type_info* type, void (*destroy)(void*)) {
    ost::platform::stackOfLastThrow.capture();
    __real___cxa_throw(exception, type, destroy);
}
}
