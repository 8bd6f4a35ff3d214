// A scripted daemon on a real Unix-domain socket, for the tests of the daemon channels: it
// accepts connections one at a time on its own thread, reads the request frame of each, records
// it and lets a handler answer. Listening starts in the constructor and stops in the destructor,
// which also removes the socket file. requests() may be read from the test's thread.
#ifndef ORVANE_TEST_FAKE_DAEMON_HPP_
#define ORVANE_TEST_FAKE_DAEMON_HPP_

#include <atomic>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <json/json.h>

namespace orvane {
namespace test {

class FakeDaemon {
 public:
  // Called once per connection with the request's payload (empty when reading was turned off
  // or the client sent no whole frame) and the connection's descriptor; whatever it writes is
  // the answer. The connection is closed when it returns.
  using Handler = std::function<void(int fd, const std::string& request)>;

  FakeDaemon(const std::string& socket_path, Handler handler, bool read_request = true);
  ~FakeDaemon();
  FakeDaemon(const FakeDaemon&) = delete;
  FakeDaemon& operator=(const FakeDaemon&) = delete;

  // The payloads received, in order, and the raw bytes of every request frame.
  std::vector<std::string> requests() const;
  std::vector<std::string> raw_frames() const;
  // The requests parsed as JSON (a trailing NUL ignored); null for one that does not parse.
  std::vector<Json::Value> json_requests() const;
  int connections() const { return connections_.load(); }

  // Writes bytes, or one frame (4-byte host-order length, then the payload).
  static void WriteAll(int fd, const std::string& bytes);
  static void WriteFrame(int fd, const std::string& payload);
  // Blocks until the client closes its end (or `timeout_ms` passes).
  static void WaitForPeerClose(int fd, int timeout_ms);

  // A handler that answers the n-th request with replies[n] as a frame, the last one repeated.
  static Handler Replies(std::vector<std::string> replies);
  // A search engine's answers: success for every request save those `fail` gives a nonzero code,
  // which is answered with it; queries find nothing.
  static Handler EngineReplies(std::function<int(const Json::Value&)> fail);
  // Parses `text`, or fails the test.
  static Json::Value Parse(const std::string& text);

 private:
  void Serve();

  std::string path_;
  Handler handler_;
  bool read_request_;
  int listen_fd_ = -1;
  int stop_pipe_[2] = {-1, -1};
  std::atomic<int> connections_{0};
  mutable std::mutex mu_;
  std::vector<std::string> requests_;
  std::vector<std::string> raw_frames_;
  std::thread thread_;
};

}  // namespace test
}  // namespace orvane

#endif  // ORVANE_TEST_FAKE_DAEMON_HPP_
