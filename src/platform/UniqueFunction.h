#pragma once
// A move-only callable: the one-shot callbacks of the daemon (queued work, completions)
// own what they capture, which std::function cannot do for move-only captures.

#include <cassert>
#include <functional>
#include <memory>
#include <type_traits>
#include <utility>

namespace mx {

template <class Signature>
class UniqueFunction;

template <class R, class... Args>
class UniqueFunction<R(Args...)> {
public:
    UniqueFunction() = default;
    UniqueFunction(std::nullptr_t) {}

    // Constrained so that it never hides the move constructor (clang-tidy does not
    // read the constraint).
    template <class F>
    requires(!std::is_same_v<std::decay_t<F>, UniqueFunction> && std::is_invocable_r_v<R, F&, Args...>)
        UniqueFunction(F&& f) // NOLINT(bugprone-forwarding-reference-overload)
        : callable_(std::make_unique<Holder<std::decay_t<F>>>(std::forward<F>(f)))
    {
    }

    UniqueFunction(UniqueFunction&&) noexcept = default;
    UniqueFunction& operator=(UniqueFunction&&) noexcept = default;
    UniqueFunction(const UniqueFunction&) = delete;
    UniqueFunction& operator=(const UniqueFunction&) = delete;

    explicit operator bool() const { return callable_ != nullptr; }

    R operator()(Args... args)
    {
        assert(callable_);
        return callable_->call(std::forward<Args>(args)...);
    }

private:
    struct Callable {
        virtual ~Callable() = default;
        virtual R call(Args... args) = 0;
    };
    template <class F>
    struct Holder final : Callable {
        explicit Holder(F&& f) : function(std::move(f)) {}
        explicit Holder(const F& f) : function(f) {}
        R call(Args... args) override { return std::invoke(function, std::forward<Args>(args)...); }
        F function;
    };

    std::unique_ptr<Callable> callable_;
};

} // namespace mx
