// Measures a running server over LDAP, beside the floor of the same minute: a bare round trip of
// messages of the same sizes between two threads over the loopback interface.
//
//   bench_ldap --port N --bind-dn DN --password-file F --pid P --json FILE [--part reads] [--entry
//   DN] [--rounds N]
//   bench_ldap ... --part changes     base searches while eight clients modify
//   bench_ldap ... --part members     adds and deletes of members of the administrative group
//
// The client is as cheap as it can be made: requests are bytes prepared beforehand, answers are
// only framed. One connection is driven by blocking calls, several by one thread that looks for
// answers without sleeping and keeps one search outstanding on each. Floor and searches alternate
// in rounds, so that whatever else the machine does meets both.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

namespace orv::bench {
namespace {

using Clock = std::chrono::steady_clock;

// ---- Sockets ------------------------------------------------------------------------------------

class Socket {
 public:
  explicit Socket(int fd) : fd_(fd) {
    if (fd < 0) throw std::runtime_error("no socket");
  }
  Socket(Socket&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  Socket(const Socket&) = delete;
  Socket& operator=(const Socket&) = delete;
  Socket& operator=(Socket&&) = delete;
  ~Socket() {
    if (fd_ >= 0) ::close(fd_);
  }
  int fd() const { return fd_; }

  void send(std::string_view bytes) const {
    while (!bytes.empty()) {
      const ssize_t sent = ::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL);
      if (sent <= 0) throw std::runtime_error("the peer is gone");
      bytes.remove_prefix(static_cast<std::size_t>(sent));
    }
  }

  std::size_t receive(char* into, std::size_t room) const {
    const ssize_t got = ::recv(fd_, into, room, 0);
    if (got <= 0) throw std::runtime_error("the peer closed the connection");
    return static_cast<std::size_t>(got);
  }

 private:
  int fd_;
};

void send_at_once(const Socket& socket) {
  const int on = 1;
  ::setsockopt(socket.fd(), IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
}

sockaddr_in loopback(std::uint16_t port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  return address;
}

Socket connect_to(std::uint16_t port) {
  Socket socket(::socket(AF_INET, SOCK_STREAM, 0));
  const sockaddr_in address = loopback(port);
  if (::connect(socket.fd(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    throw std::runtime_error("cannot connect");
  }
  send_at_once(socket);
  return socket;
}

// ---- Messages (RFC 4511 in BER) ---------------------------------------------------------------

std::string element(unsigned tag, std::string_view content) {
  std::string out(1, static_cast<char>(tag));
  if (content.size() < 0x80) {
    out += static_cast<char>(content.size());
  } else {
    out += '\x84';
    for (int shift = 24; shift >= 0; shift -= 8) {
      out += static_cast<char>((content.size() >> shift) & 0xFF);
    }
  }
  return out.append(content);
}

std::string small_number(unsigned tag, int value) {
  return element(tag, std::string(1, static_cast<char>(value)));
}

std::string message(int id, const std::string& operation) {
  return element(0x30, small_number(0x02, id) + operation);
}

std::string bind_request(const std::string& dn, const std::string& password) {
  return message(
      1, element(0x60, small_number(0x02, 3) + element(0x04, dn) + element(0x80, password)));
}

std::string equality(const std::string& type, const std::string& value) {
  return element(0xA3, element(0x04, type) + element(0x04, value));
}

std::string substring(const std::string& type, const std::string& middle) {
  return element(0xA4, element(0x04, type) + element(0x30, element(0x81, middle)));
}

std::string presence(const std::string& type) {
  return element(0x87, type);
}

std::string search_request(const std::string& base, int scope, const std::string& filter) {
  return message(
      2, element(0x63, element(0x04, base) + small_number(0x0A, scope) + small_number(0x0A, 0) +
                           small_number(0x02, 0) + small_number(0x02, 0) + small_number(0x01, 0) +
                           filter + element(0x30, "")));
}

std::string attribute(const std::string& type, const std::vector<std::string>& values) {
  std::string set;
  for (const std::string& value : values) set += element(0x04, value);
  return element(0x30, element(0x04, type) + element(0x31, set));
}

std::string replace_request(const std::string& dn, const std::string& type,
                            const std::string& value) {
  const std::string change = element(0x30, small_number(0x0A, 2) + attribute(type, {value}));
  return message(3, element(0x66, element(0x04, dn) + element(0x30, change)));
}

std::string add_request(const std::string& dn, const std::string& attributes) {
  return message(4, element(0x68, element(0x04, dn) + element(0x30, attributes)));
}

std::string delete_request(const std::string& dn) {
  return message(5, element(0x4A, dn));
}

// Frames the answers of one search after the other on one connection.
class AnswerReader {
 public:
  // Takes what arrived; true when it completes a search, whose sizes then are in the accessors.
  bool take(std::string_view bytes) {
    buffer_.append(bytes);
    std::string_view rest = std::string_view(buffer_).substr(parsed_);
    bool done = false;
    while (!done) {
      const std::size_t length = framed(rest);
      if (length == 0) break;
      done = note(rest.substr(0, length));
      rest.remove_prefix(length);
      parsed_ += length;
    }
    if (parsed_ == buffer_.size()) {
      buffer_.clear();
      parsed_ = 0;
    }
    return done;
  }

  void start() { bytes_ = entries_ = 0; }
  std::size_t bytes() const { return bytes_; }
  std::size_t entries() const { return entries_; }

 private:
  // The length of the message at the start of `bytes`; 0 while it is not whole.
  static std::size_t framed(std::string_view bytes) {
    if (bytes.size() < 2) return 0;
    const auto octet = [&](std::size_t i) { return static_cast<unsigned char>(bytes[i]); };
    std::size_t header = 2;
    std::size_t content = octet(1);
    if (content >= 0x80) {
      header += content & 0x7F;
      if (bytes.size() < header) return 0;
      content = 0;
      for (std::size_t i = 2; i < header; ++i) content = content << 8 | octet(i);
    }
    return bytes.size() < header + content ? 0 : header + content;
  }

  bool note(std::string_view whole) {
    bytes_ += whole.size();
    const std::size_t header = (whole[1] & 0x80) != 0 ? 2 + (whole[1] & 0x7F) : 2;
    const auto tag = static_cast<unsigned char>(whole[header + 3]);  // after a one-byte number
    if (tag == 0x64) {
      ++entries_;
      return false;
    }
    expect_success(whole.substr(header + 3));
    return true;
  }

  static void expect_success(std::string_view operation) {
    const std::size_t header = (operation[1] & 0x80) != 0 ? 2 + (operation[1] & 0x7F) : 2;
    if (operation[header + 2] != 0) throw std::runtime_error("the server refused");
  }

  std::string buffer_;
  std::size_t parsed_ = 0;
  std::size_t bytes_ = 0;
  std::size_t entries_ = 0;
};

// ---- Figures ------------------------------------------------------------------------------------

struct Figures {
  std::vector<double> microseconds;
  double seconds = 0;

  double percentile(double part) {
    if (microseconds.empty()) return 0;
    const auto rank =
        static_cast<std::ptrdiff_t>(part * static_cast<double>(microseconds.size() - 1));
    std::nth_element(microseconds.begin(), microseconds.begin() + rank, microseconds.end());
    return microseconds[static_cast<std::size_t>(rank)];
  }
  double rate() const {
    return seconds > 0 ? static_cast<double>(microseconds.size()) / seconds : 0;
  }
};

double micros(Clock::duration d) {
  return std::chrono::duration<double, std::micro>(d).count();
}

double median(std::vector<double> values) {
  if (values.empty()) return 0;
  std::sort(values.begin(), values.end());
  return values[values.size() / 2];
}

// ---- The floor ----------------------------------------------------------------------------------

// Answers each `request` bytes with `answer` bytes until the peer leaves.
void echo(const Socket& socket, std::size_t request, std::size_t answer) {
  std::vector<char> buffer(1 << 16);
  const std::string reply(answer, 'x');
  try {
    for (std::size_t got = 0;;) {
      got += socket.receive(buffer.data(), buffer.size());
      if (got < request) continue;
      got -= request;
      socket.send(reply);
    }
  } catch (const std::runtime_error&) {
    return;  // the other end is done
  }
}

std::pair<Socket, Socket> connected_pair() {
  const Socket listener(::socket(AF_INET, SOCK_STREAM, 0));
  sockaddr_in address = loopback(0);
  socklen_t length = sizeof address;
  auto* generic = reinterpret_cast<sockaddr*>(&address);
  if (::bind(listener.fd(), generic, length) != 0 || ::listen(listener.fd(), 1) != 0 ||
      ::getsockname(listener.fd(), generic, &length) != 0) {
    throw std::runtime_error("no loopback listener");
  }
  Socket near = connect_to(ntohs(address.sin_port));
  Socket far(::accept(listener.fd(), nullptr, nullptr));
  send_at_once(far);
  return {std::move(near), std::move(far)};
}

void receive_exactly(const Socket& socket, std::vector<char>& buffer, std::size_t wanted) {
  for (std::size_t got = 0; got < wanted;) got += socket.receive(buffer.data(), buffer.size());
}

// For at most `seconds`.
void measure_floor(Figures& figures, std::size_t request, std::size_t answer, int count,
                   double seconds) {
  auto [near, far] = connected_pair();
  std::thread peer([&far = far, request, answer] { echo(far, request, answer); });
  std::vector<char> buffer(1 << 16);
  const std::string ask(request, 'x');
  const auto begin = Clock::now();
  const auto end = begin + std::chrono::duration<double>(seconds);
  auto last = begin;
  for (int i = 0; i < count && last < end; ++i) {
    near.send(ask);
    receive_exactly(near, buffer, answer);
    const auto now = Clock::now();
    figures.microseconds.push_back(micros(now - last));
    last = now;
  }
  figures.seconds += std::chrono::duration<double>(last - begin).count();
  ::shutdown(near.fd(), SHUT_RDWR);
  peer.join();
}

// ---- The server ---------------------------------------------------------------------------------

struct Target {
  std::uint16_t port = 0;
  std::string bind_dn;
  std::string password;
};

class LdapClient {
 public:
  explicit LdapClient(const Target& target) : socket_(connect_to(target.port)), buffer_(1 << 18) {
    ask(bind_request(target.bind_dn, target.password));
  }

  // Sends a request and reads its answers to the end.
  void ask(std::string_view request) {
    begin(request);
    while (!progress()) {
    }
  }

  void begin(std::string_view request) {
    reader_.start();
    socket_.send(request);
  }

  // Reads what is there; true when the answers are complete.
  bool progress() {
    const std::size_t got = socket_.receive(buffer_.data(), buffer_.size());
    return reader_.take({buffer_.data(), got});
  }

  const AnswerReader& answers() const { return reader_; }
  int fd() const { return socket_.fd(); }

 private:
  Socket socket_;
  std::vector<char> buffer_;
  AnswerReader reader_;
};

// For at most `seconds`, but three times at least.
void measure_one(Figures& figures, LdapClient& client, const std::string& request, int count,
                 double seconds) {
  const auto begin = Clock::now();
  const auto end = begin + std::chrono::duration<double>(seconds);
  auto last = begin;
  for (int i = 0; i < count && (i < 3 || last < end); ++i) {
    client.ask(request);
    const auto now = Clock::now();
    figures.microseconds.push_back(micros(now - last));
    last = now;
  }
  figures.seconds += std::chrono::duration<double>(last - begin).count();
}

// One outstanding search on each of several connections, driven by this thread. It never sleeps: on
// one machine the server would pay for waking it up with every answer, which for clients elsewhere
// it does not.
class Crowd {
 public:
  Crowd(const Target& target, int size) : epoll_(::epoll_create1(0)) {
    for (int i = 0; i < size; ++i) clients_.emplace_back(target);
    started_.resize(clients_.size());
    for (std::size_t i = 0; i < clients_.size(); ++i) watch(i);
  }

  // For at most `seconds`, but eight searches on each connection at least.
  void measure(Figures& figures, const std::string& request, int count, double seconds) {
    const auto begin = Clock::now();
    const auto end = begin + std::chrono::duration<double>(seconds);
    const int least = count - 8 * static_cast<int>(clients_.size());
    int unsent = count;
    int unanswered = count;
    for (std::size_t i = 0; i < clients_.size() && unsent > 0; ++i, --unsent) ask(i, request);
    std::array<epoll_event, 64> events{};
    while (unanswered > 0) {
      const int ready = ::epoll_wait(epoll_.fd(), events.data(), events.size(), 0);
      for (int e = 0; e < ready; ++e) {
        const std::size_t i = events[static_cast<std::size_t>(e)].data.u64;
        if (!clients_[i].progress()) continue;
        figures.microseconds.push_back(micros(Clock::now() - started_[i]));
        --unanswered;
        if (unsent > 0 && unsent < least && Clock::now() > end) {
          unanswered -= unsent;
          unsent = 0;
        }
        if (unsent > 0) {
          --unsent;
          ask(i, request);
        }
      }
    }
    figures.seconds += std::chrono::duration<double>(Clock::now() - begin).count();
  }

 private:
  void watch(std::size_t i) {
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.u64 = i;
    ::epoll_ctl(epoll_.fd(), EPOLL_CTL_ADD, clients_[i].fd(), &event);
  }
  void ask(std::size_t i, const std::string& request) {
    started_[i] = Clock::now();
    clients_[i].begin(request);
  }

  Socket epoll_;
  std::vector<LdapClient> clients_;
  std::vector<Clock::time_point> started_;
};

// ---- Changes ------------------------------------------------------------------------------------

// Keeps one modify outstanding on each of several connections, in a thread of its own that sleeps
// while there is nothing to do.
class Modifiers {
 public:
  Modifiers(const Target& target, int size) : epoll_(::epoll_create1(0)) {
    for (int i = 0; i < size; ++i) clients_.emplace_back(target);
    for (std::size_t i = 0; i < clients_.size(); ++i) {
      epoll_event event{};
      event.events = EPOLLIN;
      event.data.u64 = i;
      ::epoll_ctl(epoll_.fd(), EPOLL_CTL_ADD, clients_[i].fd(), &event);
    }
    thread_ = std::thread([this] { run(); });
  }
  Modifiers(const Modifiers&) = delete;
  Modifiers& operator=(const Modifiers&) = delete;

  // Ends the load and tells how the modifies went.
  Figures stop() {
    stopping_ = true;
    thread_.join();
    if (failed_) throw std::runtime_error("a modify failed");
    return std::move(figures_);
  }

 private:
  void run() try {
    const auto begin = Clock::now();
    std::vector<Clock::time_point> started(clients_.size());
    const auto ask = [&](std::size_t i) {
      started[i] = Clock::now();
      clients_[i].begin(replace_request("cn=log management,cn=configuration", "description",
                                        "changed " + std::to_string(++count_) + " times"));
    };
    for (std::size_t i = 0; i < clients_.size(); ++i) ask(i);
    std::array<epoll_event, 64> events{};
    for (std::size_t outstanding = clients_.size(); outstanding > 0;) {
      const int ready = ::epoll_wait(epoll_.fd(), events.data(), events.size(), -1);
      for (int e = 0; e < ready; ++e) {
        const std::size_t i = events[static_cast<std::size_t>(e)].data.u64;
        if (!clients_[i].progress()) continue;
        figures_.microseconds.push_back(micros(Clock::now() - started[i]));
        if (stopping_) {
          --outstanding;
        } else {
          ask(i);
        }
      }
    }
    figures_.seconds = std::chrono::duration<double>(Clock::now() - begin).count();
  } catch (const std::exception&) {
    failed_ = true;
  }

  Socket epoll_;
  std::vector<LdapClient> clients_;
  Figures figures_;
  std::atomic<bool> stopping_{false};
  std::atomic<bool> failed_{false};
  int count_ = 0;
  std::thread thread_;
};

std::string member_dn(int number) {
  return "cn=bench-" + std::to_string(number) + ",cn=admingroup,cn=configuration";
}

std::string new_member(int number) {
  const std::string name = "bench-" + std::to_string(number);
  const std::vector<std::string> classes = {"top", "orv-slapdConfigEntry",
                                            "orv-slapdAdminGroupMember"};
  return add_request(member_dn(number), attribute("objectClass", classes) +
                                            attribute("cn", {name}) +
                                            attribute("orv-slapdAdminDN", {"cn=" + name}) +
                                            attribute("orv-slapdAdminRole", {"AuditAdmin"}));
}

// ---- Memory -------------------------------------------------------------------------------------

// A line of /proc/PID/status in bytes.
double status_bytes(int pid, const std::string& name) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with(name + ":")) return std::stod(line.substr(name.size() + 1)) * 1024;
  }
  return 0;
}

// By how much one request lifts the server's resident memory above what it holds before.
double peak_growth(int pid, LdapClient& client, const std::string& request) {
  std::ofstream("/proc/" + std::to_string(pid) + "/clear_refs") << 5;
  const double before = status_bytes(pid, "VmRSS");
  client.ask(request);
  return status_bytes(pid, "VmHWM") - before;
}

// ---- The report ---------------------------------------------------------------------------------

// Flat JSON: {"name": number, ...}
class Report {
 public:
  void put(const std::string& name, double value) { rows_.emplace_back(name, value); }
  void put(const std::string& name, Figures& figures) {
    put(name + "_p50_us", figures.percentile(0.5));
    put(name + "_p99_us", figures.percentile(0.99));
    put(name + "_per_second", figures.rate());
  }
  void write(const std::string& path) const {
    std::ofstream out(path);
    out << "{";
    const char* separator = "\n";
    for (const auto& [name, value] : rows_) {
      out << separator << "  \"" << name << "\": " << value;
      separator = ",\n";
    }
    out << "\n}\n";
    if (!out.flush()) throw std::runtime_error("cannot write " + path);
  }

 private:
  std::vector<std::pair<std::string, double>> rows_;
};

struct Options {
  Target target;
  std::string password_file;
  std::string json;
  std::string part = "reads";
  std::string entry = "cn=configuration";  // the one that the filter search looks for
  int pid = 0;
  int rounds = 5;
  double seconds = 0.5;  // that one round of one figure should take
};

// How often a request fits into `seconds`, tried with a few.
int repetitions(LdapClient& client, const std::string& request, double seconds) {
  Figures trial;
  measure_one(trial, client, request, 3, seconds);
  return static_cast<int>(std::clamp(seconds / (trial.seconds / 3), 3.0, 50000.0));
}

void measure_base_search(const Options& options, LdapClient& client, Report& report) {
  const std::string request = search_request("cn=configuration", 0, presence("objectClass"));
  client.ask(request);
  const std::size_t answer = client.answers().bytes();
  Crowd crowd(options.target, 8);
  Figures floor, one, eight;
  std::vector<double> latency, throughput;
  const int count = repetitions(client, request, options.seconds);
  for (int round = 0; round < options.rounds; ++round) {
    Figures round_floor, round_one, round_eight;
    measure_floor(round_floor, request.size(), answer, 20000, 2 * options.seconds);
    measure_one(round_one, client, request, count, 2 * options.seconds);
    crowd.measure(round_eight, request, 4 * count, 4 * options.seconds);
    latency.push_back(round_one.percentile(0.5) / round_floor.percentile(0.5));
    throughput.push_back(round_eight.rate() / round_floor.rate());
    for (auto [all, part] :
         {std::pair{&floor, &round_floor}, {&one, &round_one}, {&eight, &round_eight}}) {
      all->microseconds.insert(all->microseconds.end(), part->microseconds.begin(),
                               part->microseconds.end());
      all->seconds += part->seconds;
    }
  }
  report.put("request_bytes", static_cast<double>(request.size()));
  report.put("answer_bytes", static_cast<double>(answer));
  report.put("floor", floor);
  report.put("base_1", one);
  report.put("base_8", eight);
  report.put("base_1_p50_to_floor", median(latency));
  report.put("base_8_rate_to_floor", median(throughput));
}

void measure_walk(const Options& options, LdapClient& client, Report& report,
                  const std::string& name, const std::string& filter) {
  const std::string request = search_request("cn=configuration", 2, filter);
  Figures one, eight;
  const int count = repetitions(client, request, options.seconds);
  measure_one(one, client, request, count, 2 * options.seconds);
  report.put(name + "_entries", static_cast<double>(client.answers().entries()));
  report.put(name + "_bytes", static_cast<double>(client.answers().bytes()));
  Crowd crowd(options.target, 8);
  crowd.measure(eight, request, std::max(8, count), 2 * options.seconds);
  report.put(name + "_1", one);
  report.put(name + "_8", eight);
}

void measure_memory(const Options& options, LdapClient& client, Report& report) {
  if (options.pid == 0) return;
  report.put("resident_bytes", status_bytes(options.pid, "VmRSS"));
  report.put("base_peak_growth_bytes",
             peak_growth(options.pid, client,
                         search_request("cn=configuration", 0, presence("objectClass"))));
  report.put("filter_peak_growth_bytes",
             peak_growth(options.pid, client,
                         search_request("cn=configuration", 2, equality("cn", options.entry))));
}

// Base searches on a quiet server, and while eight clients modify.
void measure_changes(const Options& options, Report& report) {
  LdapClient client(options.target);
  const std::string request = search_request("cn=configuration", 0, presence("objectClass"));
  Figures quiet, busy;
  measure_one(quiet, client, request, repetitions(client, request, options.seconds),
              2 * options.seconds);
  Modifiers modifiers(options.target, 8);
  const auto end = Clock::now() + std::chrono::duration<double>(options.rounds * options.seconds);
  while (Clock::now() < end) measure_one(busy, client, request, 1, options.seconds);
  Figures modifies = modifiers.stop();
  report.put("quiet", quiet);
  report.put("busy", busy);
  report.put("modify_8", modifies);
}

void measure_members(const Options& options, Report& report) {
  LdapClient client(options.target);
  Figures adds, deletes;
  const auto end = Clock::now() + std::chrono::duration<double>(options.rounds * options.seconds);
  for (int number = 0; number < 5 || Clock::now() < end; ++number) {
    measure_one(adds, client, new_member(number), 1, options.seconds);
    measure_one(deletes, client, delete_request(member_dn(number)), 1, options.seconds);
  }
  report.put("add", adds);
  report.put("delete", deletes);
}

void measure_reads(const Options& options, Report& report) {
  LdapClient client(options.target);
  measure_memory(options, client, report);
  measure_base_search(options, client, report);
  measure_walk(options, client, report, "subtree", presence("objectClass"));
  measure_walk(options, client, report, "equality", equality("cn", options.entry));
  measure_walk(options, client, report, "substring", substring("cn", options.entry));
  report.put("subtree_peak_growth_bytes",
             peak_growth(options.pid, client,
                         search_request("cn=configuration", 2, presence("objectClass"))));
}

std::string first_line(const std::string& path) {
  std::ifstream in(path);
  std::string line;
  std::getline(in, line);
  if (line.empty()) throw std::runtime_error("no password in " + path);
  return line;
}

void run(Options& options) {
  options.target.password = first_line(options.password_file);
  Report report;
  if (options.part == "reads") measure_reads(options, report);
  if (options.part == "changes") measure_changes(options, report);
  if (options.part == "members") measure_members(options, report);
  report.write(options.json);
}

}  // namespace
}  // namespace orv::bench

int main(int argc, char** argv) {
  orv::bench::Options options;
  CLI::App app("Measures a running server over LDAP beside a bare loopback round trip");
  app.add_option("--port", options.target.port, "port on 127.0.0.1")->required();
  app.add_option("--bind-dn", options.target.bind_dn, "who binds")->required();
  app.add_option("--password-file", options.password_file, "file with the password")->required();
  app.add_option("--json", options.json, "where the figures go")->required();
  app.add_option("--part", options.part, "what is measured")
      ->check(CLI::IsMember({"reads", "changes", "members"}));
  app.add_option("--entry", options.entry, "common name that the filter searches ask for");
  app.add_option("--pid", options.pid, "process whose memory is watched");
  app.add_option("--rounds", options.rounds, "rounds of floor and base search");
  app.add_option("--seconds", options.seconds, "time for one figure of one round");
  CLI11_PARSE(app, argc, argv);
  try {
    orv::bench::run(options);
  } catch (const std::exception& error) {
    std::fprintf(stderr, "bench_ldap: %s\n", error.what());
    return 1;
  }
  return 0;
}
