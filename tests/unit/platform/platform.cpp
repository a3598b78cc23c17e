#include "platform/platform.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ostream>

#include "platform/real.h"

namespace orv::scripted {
namespace {

Platform* g_platform = nullptr;
thread_local bool t_observed = false;

const char* word(Owned kind) {
  switch (kind) {
    case Owned::memory:
      return "memory";
    case Owned::text:
      return "text";
    case Owned::cfg_text:
      return "cfg_text";
    case Owned::cfg_values:
      return "cfg_values";
    case Owned::cfg_value:
      return "cfg_value";
    case Owned::chain:
      return "chain";
    case Owned::record:
      return "record";
    case Owned::loose_record:
      return "loose_record";
    case Owned::cursor:
      return "cursor";
    case Owned::session:
      return "session";
    case Owned::part:
      return "part";
    case Owned::value:
      return "value";
    case Owned::escaped_dn:
      return "escaped_dn";
    case Owned::url:
      return "url";
    case Owned::mods:
      return "mods";
  }
  return "?";
}

// Whether free is the right way for such a block.
bool freeable(Owned kind) {
  switch (kind) {
    case Owned::memory:
    case Owned::text:
    case Owned::cfg_values:
    case Owned::cfg_value:
    case Owned::loose_record:
    case Owned::value:
      return true;
    default:
      return false;
  }
}

ssize_t write_standard_error(void* /*cookie*/, const char* text, size_t length) {
  const Unobserved unobserved;
  g_platform->record({Event::Kind::standard_error, {}, std::string(text, length)});
  return static_cast<ssize_t>(length);
}

}  // namespace

void PrintTo(const DebugLine& line, std::ostream* out) {
  *out << std::hex << line.category << std::dec << " \"" << line.text << "\"";
}

bool observed() {
  return t_observed;
}

Unobserved::Unobserved() : before_(t_observed) {
  t_observed = false;
}
Unobserved::~Unobserved() {
  t_observed = before_;
}

Platform::UnderTest::UnderTest(Platform& /*platform*/) : real_stderr_(stderr) {
  const cookie_io_functions_t functions{nullptr, write_standard_error, nullptr, nullptr};
  captured_ = fopencookie(nullptr, "w", functions);
  setvbuf(captured_, nullptr, _IOLBF, 0);
  stderr = captured_;
  t_observed = true;
}

Platform::UnderTest::~UnderTest() {
  t_observed = false;
  std::fclose(captured_);
  stderr = real_stderr_;
}

Platform::Platform() {
  g_platform = this;
}

Platform::~Platform() {
  release_leaks();
  g_platform = nullptr;
}

Platform* Platform::current() {
  return g_platform;
}

// ---- Script

void Platform::fail(const std::string& function, int nth, int result) {
  failures_.push_back({function, nth, result});
}

void Platform::at(const std::string& function, int nth, std::function<void()> action) {
  actions_.push_back({function, nth, std::move(action)});
}

void Platform::name_allocation_in(const std::string& function, int nth, const std::string& name) {
  at(function, nth, [this, name] { name_allocation(allocations_ + 1, name); });
}

void Platform::forget() {
  events_.clear();
  counts_.clear();
  failures_.clear();
  actions_.clear();
  sent.clear();
  allocation_names_.clear();
  sizes.clear();
  failing_allocation_ = 0;
  fails_from_then_on_ = false;
  allocations_ = 0;
  unlocks_of_free_ = 0;
  error = 0;
}

bool Platform::allocation_fails() {
  ++allocations_;
  const bool later = fails_from_then_on_ && allocations_ > failing_allocation_;
  return allocations_ == failing_allocation_ || later;
}

std::optional<int> Platform::begin_call(const std::string& function, const std::string& text) {
  const int nth = ++counts_[function];
  record({Event::Kind::call, function, text});
  for (const Action& action : actions_) {
    if (action.function == function && (action.nth == 0 || action.nth == nth)) action.action();
  }
  for (const Failure& failure : failures_) {
    if (failure.function == function && (failure.nth == 0 || failure.nth == nth)) {
      return failure.result;
    }
  }
  return std::nullopt;
}

std::optional<int> Call::failure_or_no_memory() const {
  if (failure_) return failure_;
  if (Platform::current()->allocation_fails()) return 90;
  return std::nullopt;
}

// ---- Findings

void Platform::record(Event event) {
  events_.push_back(std::move(event));
}

std::vector<std::string> Platform::calls(const std::set<std::string>& functions) const {
  std::vector<std::string> texts;
  for (const Event& event : events_) {
    if (event.kind != Event::Kind::call) continue;
    if (functions.empty() ? event.function == "cfg_get_errno"
                          : !functions.contains(event.function)) {
      continue;
    }
    texts.push_back(event.text);
  }
  return texts;
}

std::vector<std::string> Platform::story(const std::set<std::string>& functions) const {
  std::vector<std::string> texts;
  for (const Event& event : events_) {
    if (event.kind == Event::Kind::call && functions.contains(event.function)) {
      texts.push_back(event.text);
    } else if (event.kind == Event::Kind::debug) {
      texts.push_back("debug: " + event.text);
    } else if (event.kind == Event::Kind::standard_error) {
      texts.push_back("stderr: " + event.text);
    }
  }
  return texts;
}

int Platform::count(const std::string& function) const {
  const auto found = counts_.find(function);
  return found == counts_.end() ? 0 : found->second;
}

std::vector<DebugLine> Platform::debug_lines() const {
  std::vector<DebugLine> lines;
  for (const Event& event : events_) {
    if (event.kind == Event::Kind::debug) lines.push_back({event.number, event.text});
  }
  return lines;
}

std::vector<DebugLine> Platform::print_debug_lines() const {
  std::vector<DebugLine> lines;
  for (const Event& event : events_) {
    if (event.kind == Event::Kind::print_debug) lines.push_back({event.number, event.text});
  }
  return lines;
}

std::string Platform::standard_error() const {
  std::string text;
  for (const Event& event : events_) {
    if (event.kind == Event::Kind::standard_error) text += event.text;
  }
  return text;
}

std::vector<std::string> Platform::records() const {
  std::vector<std::string> texts;
  for (const Event& event : events_) {
    const bool entry = event.kind == Event::Kind::entry;
    if (!entry && event.kind != Event::Kind::exit) continue;
    char head[32];
    std::snprintf(head, sizeof head, "%s %08x ", entry ? "entry" : "exit", event.number);
    texts.push_back(head + event.text);
  }
  return texts;
}

// ---- Mutexes

bool Platform::held(const pthread_mutex_t* mutex) const {
  const auto found = mutexes_.find(mutex);
  return found != mutexes_.end() && found->second;
}

void Platform::set_held(const pthread_mutex_t* mutex, bool held) {
  mutexes_[mutex] = held;
}

int Platform::lock(const pthread_mutex_t* mutex) {
  if (held(mutex)) violation("waits for ever for " + show(mutex));
  mutexes_[mutex] = true;
  return 0;
}

int Platform::try_lock(const pthread_mutex_t* mutex) {
  if (held(mutex)) return EBUSY;
  mutexes_[mutex] = true;
  return 0;
}

int Platform::unlock(const pthread_mutex_t* mutex) {
  if (!held(mutex)) ++unlocks_of_free_;
  mutexes_[mutex] = false;
  return 0;
}

// ---- Ownership

void* Platform::give(Owned kind, std::size_t size) {
  void* block = real::calloc(1, size == 0 ? 1 : size);
  note(block, kind);
  return block;
}

char* Platform::give_text(Owned kind, const std::string& text) {
  auto* block = static_cast<char*>(give(kind, text.size() + 1));
  std::memcpy(block, text.c_str(), text.size() + 1);
  return block;
}

void Platform::note(void* block, Owned kind) {
  blocks_[block] = kind;
  const auto named = allocation_names_.find(allocations_);
  if (named == allocation_names_.end()) return;
  names_[block] = (kind == Owned::cfg_value ? "one of " : "") + named->second;
}

std::optional<Owned> Platform::owner(const void* block) const {
  const auto found = blocks_.find(block);
  if (found == blocks_.end()) return std::nullopt;
  return found->second;
}

void Platform::change_owner(void* block, Owned kind) {
  blocks_[block] = kind;
}

void Platform::take_back(void* block, Owned kind, const char* function) {
  if (block == nullptr) return;
  const auto found = blocks_.find(block);
  if (found == blocks_.end() || found->second != kind) {
    violation(std::string(function) + " of " +
              (found == blocks_.end() ? "an unknown block" : word(found->second)));
    return;
  }
  blocks_.erase(found);
  names_.erase(block);  // the address may come again
  real::free(block);
}

void Platform::dispose(void* block) {
  if (block == nullptr) return;
  blocks_.erase(block);
  names_.erase(block);
  real::free(block);
}

bool Platform::freed(void* block) {
  const auto found = blocks_.find(block);
  if (found == blocks_.end()) return true;
  if (!freeable(found->second)) {
    violation(std::string("free of ") + word(found->second));
    return false;
  }
  const auto named = names_.find(block);
  if (named != names_.end()) {
    record({Event::Kind::call, "free", "free(" + named->second + ")"});
    ++counts_["free"];
    names_.erase(named);
  }
  blocks_.erase(found);
  return true;
}

std::vector<std::string> Platform::leaks() const {
  std::vector<std::string> words;
  words.reserve(blocks_.size());
  for (const auto& [block, kind] : blocks_) words.emplace_back(word(kind));
  std::sort(words.begin(), words.end());
  return words;
}

void Platform::release_leaks() {
  for (const auto& [block, kind] : blocks_) real::free(const_cast<void*>(block));
  blocks_.clear();
}

// ---- Arguments

std::string Platform::show(const void* address) const {
  if (address == nullptr) return "null";
  const auto found = names_.find(address);
  return found == names_.end() ? "?" : found->second;
}

std::string show(const char* text) {
  if (text == nullptr) return "null";
  return '"' + std::string(text) + '"';
}

std::string show(char** list) {
  if (list == nullptr) return "null";
  std::string text = "[";
  for (char** item = list; *item != nullptr; ++item) {
    text += (item == list ? "" : " ") + std::string(*item);
  }
  return text + "]";
}

std::string show(int number) {
  return std::to_string(number);
}
std::string show(unsigned number) {
  return std::to_string(number);
}
std::string show(std::size_t number) {
  return std::to_string(number);
}
std::string show(std::nullptr_t) {
  return "null";
}

}  // namespace orv::scripted
