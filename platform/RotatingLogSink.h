// The rotating log file: the current file keeps its name ("berthd.log");
// when a line would take it past the size limit it becomes "berthd.log.1",
// the older ones move up by one ("berthd.log.1" to "berthd.log.2", ...) and
// the oldest beyond the kept count is dropped. Each line is written with one
// write(2) so a crash never leaves half a line behind.
#pragma once

#include <spdlog/sinks/base_sink.h>

#include <cstdint>
#include <filesystem>
#include <mutex>

#include "platform/UniqueFd.h"

namespace berth {

class RotatingLogSink final : public spdlog::sinks::base_sink<std::mutex> {
  public:
    // Opens (creating, mode 0644) the log at `path`. `rotatedFiles` is how
    // many rotated files are kept beside it. Throws spdlog::spdlog_ex if the
    // file cannot be opened.
    RotatingLogSink(std::filesystem::path path, uint32_t rotatedFiles, uint64_t sizeLimit);

    // The name of the n-th rotated file ("berthd.log.n").
    static std::filesystem::path rotatedPath(const std::filesystem::path& path, uint32_t n);

  protected:
    void sink_it_(const spdlog::details::log_msg& msg) override;
    void flush_() override;

  private:
    void openCurrent();
    void rotate();

    const std::filesystem::path path_;
    const uint32_t rotatedFiles_;
    const uint64_t sizeLimit_;
    UniqueFd fd_;
    uint64_t size_ = 0;
};

}  // namespace berth
