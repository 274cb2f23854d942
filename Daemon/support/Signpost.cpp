#include "Daemon/support/Signpost.h"

#include <atomic>

#if __has_include(<sys/sdt.h>)
#include <sys/sdt.h>
#define QRN_PROBE2(name, a, b) DTRACE_PROBE2(quarnd, name, a, b)
#define QRN_PROBE3(name, a, b, c) DTRACE_PROBE3(quarnd, name, a, b, c)
#else
#define QRN_PROBE2(name, a, b) ((void)(a), (void)(b))
#define QRN_PROBE3(name, a, b, c) ((void)(a), (void)(b), (void)(c))
#endif

namespace quarn {

namespace {

std::atomic<std::uint64_t> nextIdentifier{1};

std::string withDetail(std::string_view detail) {
    return detail.empty() ? std::string() : ": " + std::string(detail);
}

} // namespace

Signpost::Signpost(LogCategory category, std::string name, std::string detail)
    : category_(category), name_(std::move(name)),
      id_(nextIdentifier.fetch_add(1, std::memory_order_relaxed)),
      start_(std::chrono::steady_clock::now()) {
    QRN_PROBE2(signpost_begin, name_.c_str(), id_);
    QRN_LOG_DEBUG(category_, "{} [{}] begin{}", name_, id_, withDetail(detail));
}

Signpost::Signpost(Signpost&& other) noexcept
    : category_(other.category_), name_(std::move(other.name_)), id_(other.id_),
      start_(other.start_), active_(other.active_) {
    other.active_ = false;
}

Signpost& Signpost::operator=(Signpost&& other) noexcept {
    if (this != &other) {
        end();
        category_ = other.category_;
        name_ = std::move(other.name_);
        id_ = other.id_;
        start_ = other.start_;
        active_ = other.active_;
        other.active_ = false;
    }
    return *this;
}

void Signpost::end(std::string_view detail) {
    if (!active_) {
        return;
    }
    active_ = false;
    auto elapsed = std::chrono::steady_clock::now() - start_;
    auto nanoseconds = std::chrono::duration_cast<std::chrono::nanoseconds>(elapsed).count();
    QRN_PROBE3(signpost_end, name_.c_str(), id_, nanoseconds);
    QRN_LOG_DEBUG(category_, "{} [{}] end after {:.3f} ms{}", name_, id_,
                  static_cast<double>(nanoseconds) / 1e6, withDetail(detail));
}

} // namespace quarn
