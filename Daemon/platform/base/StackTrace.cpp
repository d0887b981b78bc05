#include "platform/base/StackTrace.h"

#include "platform/base/ProgramSymbols.h"

#include <unwind.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <cxxabi.h>
#include <exception>
#include <memory>
#include <new>
#include <span>
#include <typeinfo>

namespace ost::platform {

namespace {

constexpr std::size_t depthLimit = 64; // the frames that matter are the innermost

/// A longer name is not shown: taking one apart needs 64 times its length of the stack.
constexpr std::size_t longestName = 1024;

struct CallStack {
    std::array<std::uintptr_t, depthLimit> frames;
    std::size_t depth = 0;
    std::size_t toSkip = 0;

    /// Takes the stack of the calling function's caller. Allocates nothing.
    [[gnu::noinline]] void capture() noexcept;
};

/// The address that a call returns to may already be another function's, behind a call that never returns.
_Unwind_Reason_Code addFrame(_Unwind_Context* context, void* argument) {
    auto& stack = *static_cast<CallStack*>(argument);
    int isSignalFrame = 0;
    const auto address = ::_Unwind_GetIPInfo(context, &isSignalFrame);
    if (address == 0 || stack.depth == depthLimit)
        return _URC_END_OF_STACK;
    if (stack.toSkip > 0)
        --stack.toSkip;
    else
        stack.frames[stack.depth++] = isSignalFrame != 0 ? address : address - 1;
    return _URC_NO_REASON;
}

void CallStack::capture() noexcept {
    depth = 0;
    toSkip = 2; // this function and the one that calls it
    ::_Unwind_Backtrace(addFrame, this);
}

struct Throw {
    const void* exception = nullptr;
    CallStack stack;
};

thread_local Throw lastThrow;

/// What the throw of the exception that is being handled was given; null when none is.
const void* exceptionBeingHandled() {
    const auto pointer = std::current_exception();
    const void* exception = nullptr;
    static_assert(sizeof pointer == sizeof exception);
    std::memcpy(&exception, static_cast<const void*>(&pointer), sizeof exception);
    return exception;
}

std::string describe(const ProgramSymbols& symbols, const ProgramSymbols::Location& location) {
    std::array<char, 2 + 2 * sizeof location.address + 1> address;
    std::snprintf(address.data(), address.size(), "0x%zx", location.address);
    std::array<char, longestName> name;
    if (!symbols.readName(location, name))
        return address.data();
    int status = 0;
    const std::unique_ptr<char, decltype(&std::free)> readable(
        abi::__cxa_demangle(name.data(), nullptr, nullptr, &status), &std::free);
    return std::string(address.data()) + " " + (readable ? readable.get() : name.data()) + " + " +
           std::to_string(location.offset);
}

std::vector<std::string> symbolsOf(const CallStack& stack) noexcept {
    std::array<ProgramSymbols::Location, depthLimit> places;
    const auto locations = std::span(places).first(stack.depth);
    for (std::size_t i = 0; i < stack.depth; ++i)
        locations[i].address = stack.frames[i];
    const ProgramSymbols symbols;
    symbols.find(locations);
    std::vector<std::string> lines;
    try {
        lines.reserve(stack.depth);
        for (const auto& location : locations)
            lines.push_back(describe(symbols, location));
    } catch (const std::bad_alloc&) {
        return lines;
    }
    return lines;
}

} // namespace

std::vector<std::string> exceptionCallStackSymbols() noexcept {
    if (lastThrow.exception != nullptr && lastThrow.exception == exceptionBeingHandled())
        return symbolsOf(lastThrow.stack);
    CallStack handler;
    handler.capture();
    return symbolsOf(handler);
}

} // namespace ost::platform

// The linker puts this hook in front of every throw of a program, and gives the names.
extern "C" {
[[noreturn]] void __real___cxa_throw(void* exception, std::type_info* type, void (*destroy)(void*));
[[noreturn]] void __wrap___cxa_throw(void* exception, std::type_info* type, void (*destroy)(void*));

void __wrap___cxa_throw(void* exception, std::type_info* type, void (*destroy)(void*)) {
    ost::platform::lastThrow.exception = exception;
    ost::platform::lastThrow.stack.capture();
    __real___cxa_throw(exception, type, destroy);
}
}
