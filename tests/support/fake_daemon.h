// A stand-in for fileindexd in unit tests: listens on a UNIX socket in a background
// thread and records every frame that arrives, one per connection.
//
// The library writes a frame, closes and returns without a reply. The fake accepts one
// connection at a time, reads it to end of file, decodes and records it before it
// accepts the next one, and Commands()/Frames()/RawFrames() first wait until no
// connection is queued or being read. A connection that the sender's connect() has
// completed is already queued, so right after a library call returns these accessors
// include every command it sent:
//
//   FakeDaemon daemon;
//   ASSERT_TRUE(daemon.Start(SocketPath()));
//   ASSERT_TRUE(SendCammandToDaemon("pause", data));
//   ASSERT_EQ(daemon.Commands().size(), 1u);
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
  ~FakeDaemon();
  FakeDaemon(const FakeDaemon&) = delete;
  FakeDaemon& operator=(const FakeDaemon&) = delete;

  // Binds and listens on socketPath (a stale socket file there is removed first) and
  // starts serving. False when the socket cannot be made or the fake already runs.
  bool Start(const std::string& socketPath);
  // Stops serving, closes the socket and removes its file. Safe to call twice.
  void Stop();

  // The decoded command objects, in arrival order; frames that did not decode are left out.
  std::vector<Json::Value> Commands();
  // Every connection's bytes as received (length prefix included), in arrival order.
  std::vector<std::string> RawFrames();
  // Forgets what was recorded (the benchmarks reuse one daemon between runs).
  void Clear();

  const std::string& SocketPath() const { return path_; }

 private:
  void Serve();
  // With mu_ held: waits until nothing is queued on the socket nor being read.
  void SettleLocked(std::unique_lock<std::mutex>& lock);
  bool ConnectionQueued() const;

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
