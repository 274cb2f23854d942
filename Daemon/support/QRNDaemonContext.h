#pragma once
// Owner of the process-wide instances ("shared instances" of the daemon's
// classes and the platform implementations) for one root prefix.
//
// The daemon makes one context at start and makes it current; each test
// makes a fresh one on its own temporary root, possibly with fault-injecting
// platform pieces installed, so no state leaks between tests.
//
// Any layer may ask the context for an instance of its own classes: a class
// is made on first use with a constructor taking `QRNDaemonContext&` (or its
// default constructor). Abstract types (platform interfaces) must have been
// installed before they are asked for.

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <mutex>
#include <type_traits>
#include <typeindex>
#include <unordered_map>

namespace quarn {

class QRNDaemonContext {
public:
    explicit QRNDaemonContext(std::filesystem::path rootPrefix = "/")
        : rootPrefix_(std::move(rootPrefix)) {}
    QRNDaemonContext(const QRNDaemonContext&) = delete;
    QRNDaemonContext& operator=(const QRNDaemonContext&) = delete;

    // The context that the shared-instance accessors use.
    static QRNDaemonContext& current();
    static bool hasCurrent();
    static void setCurrent(std::shared_ptr<QRNDaemonContext> context);

    const std::filesystem::path& rootPrefix() const { return rootPrefix_; }

    template <class T> void install(std::shared_ptr<T> instance) {
        std::lock_guard guard(mutex_);
        publish<T>(instance.get());
        instances_[std::type_index(typeid(T))] = std::move(instance);
    }

    template <class T> bool has() const {
        std::lock_guard guard(mutex_);
        return instances_.count(std::type_index(typeid(T))) != 0;
    }

    // Without a lock once the instance exists: a request asks for the same
    // few instances many times, from every worker thread at once.
    template <class T> T& instance() {
        const std::size_t slot = slotOf<T>();
        if (slot < kFastSlots) {
            if (void* known = fast_[slot].load(std::memory_order_acquire)) {
                return *static_cast<T*>(known);
            }
        }
        return *sharedInstance<T>();
    }

    template <class T> std::shared_ptr<T> sharedInstance() {
        // Recursive: making one instance may ask for the instances it needs.
        std::lock_guard guard(mutex_);
        auto key = std::type_index(typeid(T));
        if (auto it = instances_.find(key); it != instances_.end()) {
            return std::static_pointer_cast<T>(it->second);
        }
        std::shared_ptr<T> made;
        if constexpr (std::is_abstract_v<T>) {
            std::fprintf(stderr, "QRNDaemonContext: no implementation installed for %s\n",
                         typeid(T).name());
            std::abort();
        } else if constexpr (std::is_constructible_v<T, QRNDaemonContext&>) {
            made = std::make_shared<T>(*this);
        } else {
            made = std::make_shared<T>();
        }
        publish<T>(made.get());
        instances_[key] = made;
        return made;
    }

private:
    static constexpr std::size_t kFastSlots = 64;

    // A small number per type, the same in every context; types past the
    // fast slots are only found through the map.
    static std::size_t nextSlot();
    template <class T> static std::size_t slotOf() {
        static const std::size_t slot = nextSlot();
        return slot;
    }
    // With mutex_ held; the map keeps the instance alive.
    template <class T> void publish(T* instance) {
        if (const std::size_t slot = slotOf<T>(); slot < kFastSlots) {
            fast_[slot].store(instance, std::memory_order_release);
        }
    }

    std::filesystem::path rootPrefix_;
    // Guards instances_; recursive because constructors ask for their dependencies.
    mutable std::recursive_mutex mutex_;
    std::unordered_map<std::type_index, std::shared_ptr<void>> instances_;
    // Raw pointers to the instances of instances_, by slot; written with
    // mutex_ held, read without it.
    std::array<std::atomic<void*>, kFastSlots> fast_{};
};

} // namespace quarn
