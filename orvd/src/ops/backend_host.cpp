#include "ops/backend_host.h"

#include <exception>
#include <new>
#include <thread>
#include <utility>

#include "cfg/result_codes.h"
#include "ops/answer.h"

namespace orv::server {

BackendHost::BackendHost(Backend& backend, std::function<void(std::string_view)> on_failure)
    : backend_(backend), on_failure_(std::move(on_failure)) {
  install_senders(rest_connection_);
  rest_parameters_ = make_parameters(backend_, rest_connection_, rest_operation_);
  if (!rest_parameters_) throw std::bad_alloc();
  slapi_pblock_set(rest_parameters_.get(), parameter::target_dn, "CN=CONFIGURATION");
  slapi_pblock_set(rest_parameters_.get(), parameter::search_filter_text, "(objectClass=*)");
}

Handler BackendHost::handler_of(int number) const noexcept {
  return slapi_pblock_handler(backend_.handlers, number);
}

int BackendHost::guarded(int number, pblock* parameters) noexcept {
  const Handler handler = handler_of(number);
  if (!handler) return result::unwilling_to_perform;
  const char* why = "unknown exception";
  std::exception_ptr thrown;  // keeps the text alive
  try {
    return handler(parameters);
  } catch (const std::exception& e) {
    thrown = std::current_exception();
    why = e.what();
  } catch (const char* message) {
    why = message;
  } catch (...) {
  }
  failed_.store(true, std::memory_order_release);
  gate_.close();
  try {
    on_failure_(why);
  } catch (...) {
    // Without memory to say why; what it is asked for is done by failed() all the same.
  }
  return result::unavailable;
}

int BackendHost::call_inside_gate(int handler, pblock* parameters, Connection& connection,
                                  bool leaves_slot) {
  const int code = call_keeping_gate(handler, parameters, connection, leaves_slot);
  leave_gate();
  return code;
}

int BackendHost::call_keeping_gate(int handler, pblock* parameters, Connection& connection,
                                   bool leaves_slot) noexcept {
  const int code = guarded(handler, parameters);
  left_slot_ = !failed() && leaves_slot && connection.config_session;
  if (left_slot_) return_to_rest(connection);
  return code;
}

void BackendHost::leave_gate() noexcept {
  // A failed backend keeps the gate: whoever held its lock holds it still.
  if (!failed()) gate_.leave();
}

int BackendHost::call(int handler, pblock* parameters) noexcept {
  in_call_.fetch_add(1);
  const int code = failed() ? result::unavailable : guarded(handler, parameters);
  in_call_.fetch_sub(1);
  return code;
}

bool BackendHost::calls_ended(std::chrono::milliseconds patience) noexcept {
  const Clock::time_point end = Clock::now() + patience;
  while (in_call_.load() != 0 && Clock::now() < end)
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  return in_call_.load() == 0;
}

void BackendHost::return_to_rest(Connection& connection) noexcept {
  rest_connection_.config_session = std::exchange(connection.config_session, nullptr);
  guarded(parameter::search_function, rest_parameters_.get());
}

bool BackendHost::close(std::chrono::milliseconds patience) {
  if (failed()) return false;
  if (!gate_.close_and_wait_until_empty(patience)) return false;
  Connection internal;
  install_senders(internal);
  Operation nobody;
  const PblockPtr parameters = make_parameters(backend_, internal, nobody);
  if (!parameters) return false;
  guarded(parameter::close_function, parameters.get());
  return !failed();
}

PblockPtr make_parameters(Backend& backend, Connection& connection, Operation& operation) {
  PblockPtr parameters(slapi_pblock_new());
  if (!parameters) return parameters;
  slapi_pblock_set(parameters.get(), parameter::backend, static_cast<void*>(&backend));
  slapi_pblock_set(parameters.get(), parameter::connection, static_cast<void*>(&connection));
  slapi_pblock_set(parameters.get(), parameter::operation, static_cast<void*>(&operation));
  operation.parameters = parameters.get();
  return parameters;
}

}  // namespace orv::server
