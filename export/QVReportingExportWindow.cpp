#include "QVReportingExportWindow.h"

#include <algorithm>

namespace qv::exporter {

std::uint64_t QVReportingExportWindow::add(std::uint64_t seq, std::string text, double time) {
    if (seq <= last_) {
        return 0;
    }
    const std::uint64_t missing = seq - last_ - 1;
    last_ = seq;
    lines_.push_back(Line{seq, std::move(text), time, State::Waiting, false, 0});
    if (lines_.size() == 1) {
        cursor_ = seq - 1;  // the expired lines before it are behind the cursor now
    }
    return missing;
}

std::vector<QVReportingExportWindow::Outgoing> QVReportingExportWindow::take(std::size_t limit,
                                                                             double now) {
    std::vector<Outgoing> out;
    if (settling_) {
        return out;
    }
    for (; next_ < lines_.size() && out.size() < limit; ++next_) {
        auto& line = lines_[next_];
        if (line.state != State::Waiting) {
            continue;
        }
        out.push_back(Outgoing{line.seq, std::string_view(line.text), line.sent});
        line.state = State::InFlight;
        line.sent = true;
        line.sentAt = now;
        ++inFlight_;
    }
    return out;
}

QVReportingExportWindow::Line* QVReportingExportWindow::find(std::uint64_t seq) {
    const auto found =
        std::lower_bound(lines_.begin(), lines_.end(), seq,
                         [](const Line& line, std::uint64_t s) { return line.seq < s; });
    return found != lines_.end() && found->seq == seq ? &*found : nullptr;
}

bool QVReportingExportWindow::acknowledge(std::uint64_t seq) {
    Line* line = find(seq);
    if (!line || line->state != State::InFlight) {
        return false;
    }
    line->state = State::Acknowledged;
    --inFlight_;
    advance();
    rewindWhenSettled();
    return true;
}

bool QVReportingExportWindow::fail(std::uint64_t seq) {
    Line* line = find(seq);
    if (!line || line->state != State::InFlight) {
        return false;
    }
    line->state = State::Waiting;
    --inFlight_;
    settling_ = true;
    rewindWhenSettled();
    return true;
}

std::size_t QVReportingExportWindow::failAll() {
    const std::size_t failed = inFlight_;
    for (auto& line : lines_) {
        if (line.state == State::InFlight) {
            line.state = State::Waiting;
        }
    }
    inFlight_ = 0;
    settling_ = failed > 0 || settling_;
    rewindWhenSettled();
    return failed;
}

void QVReportingExportWindow::advance() {
    while (!lines_.empty() && lines_.front().state == State::Acknowledged) {
        lines_.pop_front();
        if (next_ > 0) {
            --next_;
        }
    }
    cursor_ = lines_.empty() ? last_ : lines_.front().seq - 1;
}

void QVReportingExportWindow::rewindWhenSettled() {
    if (settling_ && inFlight_ == 0) {
        settling_ = false;
        next_ = 0;
    }
}

std::optional<double> QVReportingExportWindow::oldestSentAt() const {
    // Lines go out in seq order, and after a failure again from the oldest once none is in
    // flight, so the first line in flight is the one sent longest ago.
    if (inFlight_ == 0) {
        return std::nullopt;
    }
    for (const auto& line : lines_) {
        if (line.state == State::InFlight) {
            return line.sentAt;
        }
    }
    return std::nullopt;
}

std::optional<double> QVReportingExportWindow::oldestTime() const {
    if (lines_.empty()) {
        return std::nullopt;
    }
    return lines_.front().time;
}

}  // namespace qv::exporter
