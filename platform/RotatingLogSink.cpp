#include "platform/RotatingLogSink.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <string>

namespace berth {

RotatingLogSink::RotatingLogSink(std::filesystem::path path, uint32_t rotatedFiles,
                                 uint64_t sizeLimit)
    : path_(std::move(path)), rotatedFiles_(rotatedFiles), sizeLimit_(sizeLimit) {
    openCurrent();
}

std::filesystem::path RotatingLogSink::rotatedPath(const std::filesystem::path& path, uint32_t n) {
    return path.string() + "." + std::to_string(n);
}

void RotatingLogSink::openCurrent() {
    fd_.reset(::open(path_.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | O_NOFOLLOW, 0644));
    if (!fd_) spdlog::throw_spdlog_ex("cannot open log file " + path_.string(), errno);
    struct stat st;
    size_ = ::fstat(fd_.get(), &st) == 0 ? static_cast<uint64_t>(st.st_size) : 0;
}

void RotatingLogSink::rotate() {
    fd_.reset();
    if (rotatedFiles_ == 0) {
        ::unlink(path_.c_str());
    } else {
        ::unlink(rotatedPath(path_, rotatedFiles_).c_str());
        for (uint32_t n = rotatedFiles_; n > 1; --n)
            ::rename(rotatedPath(path_, n - 1).c_str(), rotatedPath(path_, n).c_str());
        ::rename(path_.c_str(), rotatedPath(path_, 1).c_str());
    }
    openCurrent();
}

void RotatingLogSink::sink_it_(const spdlog::details::log_msg& msg) {
    spdlog::memory_buf_t line;
    formatter_->format(msg, line);
    if (size_ > 0 && size_ + line.size() > sizeLimit_) rotate();
    const char* data = line.data();
    size_t left = line.size();
    while (left > 0) {
        ssize_t n = ::write(fd_.get(), data, left);
        if (n < 0) {
            if (errno == EINTR) continue;
            return;  // a full disk must not take the daemon down with it
        }
        data += n;
        left -= static_cast<size_t>(n);
    }
    size_ += line.size();
}

void RotatingLogSink::flush_() {}

}  // namespace berth
