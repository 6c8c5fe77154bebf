// What a block printed on one of the standard streams.
#pragma once

#include <unistd.h>

#include <cstdio>
#include <string>

class StreamCapture {
 public:
  explicit StreamCapture(FILE* stream) : stream_(stream), fd_(fileno(stream)) {
    std::fflush(stream_);
    saved_ = dup(fd_);
    file_ = std::tmpfile();
    dup2(fileno(file_), fd_);
  }
  StreamCapture(const StreamCapture&) = delete;
  StreamCapture& operator=(const StreamCapture&) = delete;
  ~StreamCapture() { Text(); }
  // What was printed so far; the stream goes back to where it went before.
  std::string Text() {
    if (!file_) return text_;
    std::fflush(stream_);
    dup2(saved_, fd_);
    close(saved_);
    std::rewind(file_);
    char buf[4096];
    size_t n;
    while ((n = std::fread(buf, 1, sizeof buf, file_)) > 0) text_.append(buf, n);
    std::fclose(file_);
    file_ = nullptr;
    return text_;
  }

 private:
  FILE* stream_;
  int fd_, saved_ = -1;
  FILE* file_ = nullptr;
  std::string text_;
};
