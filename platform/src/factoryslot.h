// The installed implementation of a platform factory: the built-in one unless a test has
// installed another.
#pragma once

#include <memory>
#include <mutex>
#include <utility>

namespace kestrel {

template <class Impl>
class FactorySlot {
  public:
    explicit FactorySlot(std::shared_ptr<Impl> builtIn)
        : builtIn_(builtIn), current_(std::move(builtIn)) {}

    // The installed implementation, held by the caller for the duration of one call even if it
    // is replaced meanwhile.
    std::shared_ptr<Impl> Current() const {
        std::lock_guard<std::mutex> lock(mutex_);
        return current_;
    }

    std::shared_ptr<Impl> BuiltIn() const { return builtIn_; }

    // Installs impl (null: the built-in one) and returns the one it replaces.
    std::shared_ptr<Impl> Install(std::shared_ptr<Impl> impl) {
        std::lock_guard<std::mutex> lock(mutex_);
        if (!impl)
            impl = builtIn_;
        std::swap(current_, impl);
        return impl;
    }

  private:
    mutable std::mutex mutex_;
    const std::shared_ptr<Impl> builtIn_;
    std::shared_ptr<Impl> current_;
};

}  // namespace kestrel
