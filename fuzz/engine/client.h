// One connection without a socket: it cuts what it is fed into messages and hands them over as a
// connection does, and keeps account of what is to be answered.
//
// What it holds the session to, whatever is sent:
//   every request that has an answer gets exactly one, unless it was given up or the connection
//   ended; nothing else is ever answered;
//   who is not bound sees nothing but the entries that everybody may see, around changes either;
//   after a bind that failed the connection is anonymous.
#pragma once

#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>

#include "ops/session.h"
#include "world.h"

namespace orv::fuzz {

class FuzzedClient final : public server::Session {
 public:
  FuzzedClient(Round& round, std::uint64_t number, server::TransportFacts facts);
  ~FuzzedClient() override;

  // ---- the client's side
  void receive(std::string_view bytes);
  void leave();
  // While it does not read, its output piles up.
  void stop_reading() { reading_ = false; }
  void go_on_reading();
  std::int32_t next_id() { return ++last_id_; }
  // What the server gave out last for the next page; used up or not.
  const std::string& cookie() const { return cookie_; }

  // ---- the loop's side
  // Runs the oldest of what was posted; false when there is nothing.
  bool run_one();
  void look_after() { tick(); }

  bool open() const { return open_; }
  bool settled_already() const { return settled_; }
  // After everything has come to rest: that nothing was left unanswered.
  void check_answers() const;

  // Whether somebody abandoned the operation while it ran is nothing that a run should hang on.
  bool lost_interest(server::PendingOperation&) noexcept override { return false; }

 protected:
  const server::Settings& settings() const noexcept override { return round_.settings(); }
  void post(std::function<void()> work) override;
  void transmit(std::string& bytes) override;
  void lend_storage(std::string&) noexcept override {}
  void flush() override {}
  void disconnect(int code, std::string_view text) override;
  void drop() override { close(); }
  void resume() override { process(); }
  void settled() override;
  bool can_start_tls() const noexcept override { return true; }
  void start_tls() override;
  bool more_is_here() const noexcept override { return more_is_here_; }
  void protect(std::unique_ptr<server::SecurityLayer> layer) override;

 private:
  // Of one message id.
  struct Owed {
    int answers = 0;   // that have to come
    int possible = 0;  // that may come: their requests were given up, or are persistent
  };

  void process();
  void close();
  void expect(std::string_view frame);
  void take_answer(std::string_view message);
  void check_entry(std::string_view operation) const;
  void check_controls(std::string_view controls);

  Round& round_;
  std::string in_;
  std::size_t unread_ = 0;
  bool reading_ = true;
  bool processing_ = false;
  bool more_is_here_ = false;
  bool open_ = true;
  bool settled_ = false;
  bool was_somebody_ = false;
  std::int32_t last_id_ = 0;
  std::string cookie_;
  std::map<std::int32_t, Owed> owed_;
  std::unique_ptr<server::SecurityLayer> layer_;

  std::mutex mutex_;
  std::deque<std::function<void()>> posted_;  // under the mutex
};

}  // namespace orv::fuzz
