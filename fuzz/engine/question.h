// A SASL mechanism of two steps: it asks one question, and wants the answer kSecret. With "layer"
// as the first message it negotiates a security layer, with "throw" it runs out of memory.
#pragma once

#include <memory>
#include <new>
#include <optional>
#include <string>
#include <string_view>

#include "auth/sasl.h"
#include "world.h"

namespace orv::fuzz {

// Protects nothing: what it stands for is that there is one.
class OpenLayer final : public server::SecurityLayer {
 public:
  bool wrap(std::string_view clear, std::string& wire) override {
    wire += clear;
    return true;
  }
  bool unwrap(std::string_view wire, std::string& clear) override {
    clear += wire;
    return true;
  }
  bool has_part() const noexcept override { return false; }
};

class QuestionExchange final : public server::SaslExchange {
 public:
  server::SaslOutcome step(std::optional<std::string_view> credentials) override {
    server::SaslOutcome outcome;
    outcome.name = "asker";
    if (credentials == "throw") throw std::bad_alloc();
    if (!asked_) {
      asked_ = true;
      wants_layer_ = credentials == "layer";
      outcome.state = server::SaslOutcome::State::go_on;
      outcome.reply = "what?";
      return outcome;
    }
    if (credentials != kSecret) return outcome;
    outcome.state = server::SaslOutcome::State::done;
    outcome.identity = std::make_shared<server::Identity>(
        server::Identity{"CN=ASKER", 0x0C, 0, "CN=CONFIGURATION"});
    if (wants_layer_) outcome.layer = std::make_unique<OpenLayer>();
    return outcome;
  }

 private:
  bool asked_ = false;
  bool wants_layer_ = false;
};

class Question final : public server::SaslMechanism {
 public:
  std::string_view name() const noexcept override { return "QUESTION"; }
  bool offered(const server::TransportFacts&) const override { return true; }
  std::unique_ptr<server::SaslExchange> start(const server::TransportFacts&) const override {
    return std::make_unique<QuestionExchange>();
  }
};

}  // namespace orv::fuzz
