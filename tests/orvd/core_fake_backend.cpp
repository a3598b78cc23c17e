#include "core_fake_backend.h"

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <memory>

namespace orv::server::test {
namespace {

FakeBackend* current = nullptr;

}  // namespace

template <int number>
int FakeBackend::handle(pblock* parameters) {
  return current->run(number, parameters);
}

FakeBackend::FakeBackend() : handlers_(slapi_pblock_new()) {
  current = this;
  calls_.reserve(4096);  // what the handlers do themselves takes no memory, as a rule
  using namespace parameter;
  slapi_pblock_set(handlers_.get(), bind_function, &handle<bind_function>);
  slapi_pblock_set(handlers_.get(), unbind_function, &handle<unbind_function>);
  slapi_pblock_set(handlers_.get(), search_function, &handle<search_function>);
  slapi_pblock_set(handlers_.get(), modify_function, &handle<modify_function>);
  slapi_pblock_set(handlers_.get(), add_function, &handle<add_function>);
  slapi_pblock_set(handlers_.get(), delete_function, &handle<delete_function>);
  slapi_pblock_set(handlers_.get(), close_function, &handle<close_function>);
  record_.suffixes = suffixes_;
  record_.handlers = handlers_.get();
  on_search = [](pblock* parameters) { return finish_search(parameters, 0, 0); };
  on_change = [](pblock* parameters) { return finish_change(parameters, 53); };
  on_bind = [](pblock*) { return 49; };
  on_unbind = [](pblock*) { return 0; };
}

FakeBackend::~FakeBackend() {
  current = nullptr;
}

int FakeBackend::calls(int handler) const {
  const std::lock_guard lock(mutex_);
  return static_cast<int>(std::count(calls_.begin(), calls_.end(), handler));
}

int FakeBackend::run(int number, pblock* parameters) {
  {
    const std::lock_guard lock(mutex_);
    calls_.push_back(number);
  }
  if (number == parameter::bind_function) return on_bind(parameters);
  if (number == parameter::unbind_function) return on_unbind(parameters);
  struct Inside {
    explicit Inside(FakeBackend& b) : backend(b) {
      const int now = ++backend.inside_;
      int most = backend.most_inside_.load();
      while (now > most && !backend.most_inside_.compare_exchange_weak(most, now)) {
      }
    }
    ~Inside() { --backend.inside_; }
    FakeBackend& backend;
  } inside(*this);
  if (number == parameter::search_function) return on_search(parameters);
  if (number != parameter::close_function) return on_change(parameters);
  ++closes_;
  return 0;
}

Connection* connection_of(pblock* parameters) {
  Connection* connection = nullptr;
  slapi_pblock_get(parameters, parameter::connection, &connection);
  return connection;
}

Operation* operation_of(pblock* parameters) {
  Operation* operation = nullptr;
  slapi_pblock_get(parameters, parameter::operation, &operation);
  return operation;
}

std::string target_of(pblock* parameters) {
  const char* dn = nullptr;
  slapi_pblock_get(parameters, parameter::target_dn, &dn);
  return dn ? dn : "";
}

EntryPtr make_test_entry(const std::string& dn, std::size_t value_bytes) {
  EntryPtr made(static_cast<entry*>(std::calloc(1, sizeof(entry))));
  made->dn = strdup(dn.c_str());
  made->normalized_dn = strdup(dn.c_str());
  std::string text(value_bytes, 'x');
  berval value{text.size(), text.data()};
  berval* values[] = {&value, nullptr};
  attr_merge(made.get(), "cn", values, 1, 1, nullptr);
  return made;
}

int send_test_entry(pblock* parameters, entry& e) {
  Connection* const connection = connection_of(parameters);
  char** attributes = nullptr;
  int types_only = 0;
  Backend* backend = nullptr;
  slapi_pblock_get(parameters, parameter::search_attributes, &attributes);
  slapi_pblock_get(parameters, parameter::search_types_only, &types_only);
  slapi_pblock_get(parameters, parameter::backend, &backend);
  return connection->send_search_entry(backend, connection, operation_of(parameters), &e,
                                       attributes, types_only, nullptr, nullptr, nullptr, nullptr);
}

int finish_search(pblock* parameters, int code, int entries) {
  Connection* const connection = connection_of(parameters);
  connection->send_search_result(connection, operation_of(parameters), code, nullptr, nullptr,
                                 entries);
  return code;
}

int finish_change(pblock* parameters, int code) {
  send_ldap_result(connection_of(parameters), operation_of(parameters), code, nullptr, "");
  return code;
}

Gate::Entry enter_at_once(Gate& gate) {
  class NoWaiter final : public GateWaiter {
    void gate_decided(Verdict) noexcept override {}
  };
  return gate.enter(std::make_shared<NoWaiter>(), Clock::time_point::max());
}

bool is_open(Gate& gate) {
  const bool open = enter_at_once(gate) == Gate::Entry::inside;
  if (open) gate.leave();
  return open;
}

void Event::happen() {
  const std::lock_guard lock(mutex_);
  happened_ = true;
  changed_.notify_all();
}

bool Event::wait() {
  std::unique_lock lock(mutex_);
  return changed_.wait_for(lock, std::chrono::seconds(10), [this] { return happened_; });
}

}  // namespace orv::server::test
