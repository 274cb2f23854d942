#include "LogCapture.h"

namespace quarn::test {

class LogCapture::Sink : public spdlog::sinks::base_sink<std::mutex> {
public:
    std::vector<std::string> snapshot() {
        std::lock_guard guard(mutex_);
        return lines_;
    }
    void reset() {
        std::lock_guard guard(mutex_);
        lines_.clear();
    }

protected:
    void sink_it_(const spdlog::details::log_msg& msg) override {
        lines_.emplace_back(msg.payload.data(), msg.payload.size());
    }
    void flush_() override {}

private:
    std::vector<std::string> lines_; // guarded by the base sink's mutex_
};

LogCapture::LogCapture() : sink_(std::make_shared<Sink>()) {
    previousLevel_ = Log::logger(LogCategory::Unspecified).level();
    Log::setLevel(spdlog::level::debug);
    Log::sink()->add_sink(sink_);
}

LogCapture::~LogCapture() {
    Log::sink()->remove_sink(sink_);
    Log::setLevel(previousLevel_);
}

std::vector<std::string> LogCapture::messages() const {
    return sink_->snapshot();
}

bool LogCapture::contains(std::string_view fragment) const {
    return count(fragment) > 0;
}

std::size_t LogCapture::count(std::string_view fragment) const {
    std::size_t n = 0;
    for (const auto& line : sink_->snapshot()) {
        if (line.find(fragment) != std::string::npos) {
            ++n;
        }
    }
    return n;
}

std::string LogCapture::all() const {
    std::string out;
    for (const auto& line : sink_->snapshot()) {
        out += line;
        out += '\n';
    }
    return out;
}

void LogCapture::clear() {
    sink_->reset();
}

} // namespace quarn::test
