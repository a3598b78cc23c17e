// Something that is waited for again and again: the next connection, a signal, the turn of a clock.
//
// Where memory is short a context loses a handler, before it is called or when it is to be waited
// for again, and throws. Whoever runs the context then finds what is under way no more, and begins
// it anew.
//
// Threads: that of the context. Handlers may outlive the object.
#pragma once

#include <memory>
#include <utility>

namespace orv::server {

class Standing {
 public:
  // What the context is given for a handler.
  template <typename Handler>
  class Kept {
   public:
    Kept(std::shared_ptr<bool> under_way, Handler handler)
        : under_way_(std::move(under_way)), handler_(std::move(handler)) {
      *under_way_ = true;
    }
    ~Kept() { end(); }
    Kept(Kept&&) noexcept = default;
    Kept& operator=(Kept&&) = delete;

    template <typename... Arguments>
    void operator()(Arguments&&... arguments) {
      end();
      handler_(std::forward<Arguments>(arguments)...);
    }

   private:
    void end() noexcept {
      if (under_way_) *under_way_ = false;
      under_way_.reset();
    }
    std::shared_ptr<bool> under_way_;  // null: called, or moved from
    Handler handler_;
  };

  // Counts as under way from here on until it is called, or dropped without that.
  template <typename Handler>
  Kept<Handler> keep(Handler handler) {
    return Kept<Handler>(under_way_, std::move(handler));
  }
  bool under_way() const noexcept { return *under_way_; }

 private:
  const std::shared_ptr<bool> under_way_ = std::make_shared<bool>(false);
};

}  // namespace orv::server
