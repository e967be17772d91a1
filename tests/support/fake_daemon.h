// A stand-in for fileindexd: a background thread on a UNIX socket that records every frame,
// one per connection. Connections are read one at a time, to end of file, and the accessors
// first wait until none is queued or being read; since a sender's completed connect() is
// already queued, they include every command a library call sent before it returned.
#ifndef FILEINDEX_TESTS_FAKE_DAEMON_H
#define FILEINDEX_TESTS_FAKE_DAEMON_H

#include <json/json.h>

#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "frame_decoder.h"

class FakeDaemon {
 public:
  FakeDaemon() = default;
  ~FakeDaemon() { Stop(); }
  FakeDaemon(const FakeDaemon&) = delete;
  FakeDaemon& operator=(const FakeDaemon&) = delete;

  // Listens on socketPath (replacing a stale socket); false when that fails or already running.
  bool Start(const std::string& socketPath);
  void Stop();  // closes and removes the socket; safe to call twice

  std::vector<Json::Value> Commands();   // decoded commands in arrival order, undecodable left out
  std::vector<std::string> RawFrames();  // every connection's bytes, length prefix included
  void Clear();                          // forgets what was recorded
  const std::string& SocketPath() const { return path_; }

 private:
  void Serve();
  // Waits (up to 5 s) until nothing is queued nor being read; the frames, forgotten when clear.
  std::vector<fileindex_frame::DecodedFrame> Settled(bool clear);

  std::string path_;
  int listenFd_ = -1;
  int wakePipe_[2] = {-1, -1};
  std::thread thread_;
  std::mutex mu_;
  std::condition_variable cv_;
  bool busy_ = false;
  std::vector<fileindex_frame::DecodedFrame> frames_;
};

#endif
