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
        instances_[std::type_index(typeid(T))] = std::move(instance);
    }

    template <class T> bool has() const {
        std::lock_guard guard(mutex_);
        return instances_.count(std::type_index(typeid(T))) != 0;
    }

    template <class T> T& instance() { return *sharedInstance<T>(); }

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
        instances_[key] = made;
        return made;
    }

private:
    std::filesystem::path rootPrefix_;
    // Guards instances_; recursive because constructors ask for their dependencies.
    mutable std::recursive_mutex mutex_;
    std::unordered_map<std::type_index, std::shared_ptr<void>> instances_;
};

} // namespace quarn
