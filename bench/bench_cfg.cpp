// What opening a session and searching cost, on generated configurations, beside the floor measured
// in the same run: reading the file and finding its newlines.
//
//   bench_cfg [--json FILE] [--seconds N] [--entries N[,N...]]
//
// Prints a table; writes the same figures as JSON to FILE, or after the table. Times are
// medians of the repetitions, in microseconds of processor time. The floor reads into memory that
// it keeps, as the library does.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <functional>
#include <iostream>
#include <string>
#include <vector>

#include "cfg/attribute_table.h"
#include "cfg/object_class_table.h"
#include "cfg/owners.h"
#include "cfg/session.h"
#include "sizes.h"

namespace {

using Clock = std::chrono::steady_clock;

// ---- The configuration ----

void append_entry(std::string& text, std::size_t number) {
  const std::string id = std::to_string(number);
  const bool group = number % 50 == 0;
  const std::string parent = group ? "" : ",cn=Group " + std::to_string(number / 50 * 50);
  text +=
      "dn: cn=" + std::string(group ? "Group " : "Setting ") + id + parent + ",cn=Configuration\n";
  text += "objectClass: top\nobjectClass: orv-slapdConfigEntry\n";
  text += "cn: " + std::string(group ? "Group " : "Setting ") + id + "\n";
  text += "description: What setting number " + id + " is there for, in a line of words\n";
  text += "orv-slapdAdminDN: cn=member-" + id + ",ou=Operations,o=Example Corporation\n";
  text += "orv-slapdAdminRole: ServerConfigGroupMember\n";
  text += "orv-slapdAdminRole: SchemaAdmin\n";
  text += "orv-slapdIpAddress: 192.0.2." + std::to_string(number % 250 + 1) + "\n";
  text += "orv-slapdLog: /var/log/orv/setting-" + id + ".log\n\n";
}

std::string make_configuration(std::size_t entries) {
  std::string text =
      "# A generated configuration.\n\ndn: cn=Configuration\nobjectClass: top\n"
      "objectClass: orv-slapdTop\ncn: Configuration\norv-slapdAdminDN: cn=root\n"
      "orv-slapdAdminPW: {SSHA512}bm90IGEgcGFzc3dvcmQ=\n\n";
  for (std::size_t i = 0; i + 1 < entries; ++i) append_entry(text, i);
  return text;
}

void register_types() {
  using orv::cfg::AttributeType;
  using orv::cfg::MatchingRule;
  std::vector<AttributeType> types(3);
  types[0].name = "cn";
  types[0].oid = "2.5.4.3";
  types[0].aliases = {"commonName"};
  types[1].name = "objectClass";
  types[1].oid = "2.5.4.0";
  types[1].equality = MatchingRule::object_identifier;
  types[2].name = "orv-slapdAdminPW";
  types[2].oid = "2.25.1";
  types[2].secret = true;
  orv::cfg::register_attribute_types(std::move(types));
  orv::cfg::register_object_classes({{"top", "2.5.6.0", {}},
                                     {"orv-slapdConfigEntry", "2.25.2", {}},
                                     {"orv-slapdTop", "2.25.3", {}}});
}

// ---- What is measured ----

[[noreturn]] void fail(const std::string& what) {
  std::cerr << "bench_cfg: " << what << "\n";
  std::exit(1);
}

// Reads the file and finds its newlines.
std::size_t floor_once(const char* path, std::vector<char>& memory) {
  const int file = ::open(path, O_RDONLY | O_CLOEXEC);
  struct stat status {};
  if (file < 0 || ::fstat(file, &status) != 0) fail("cannot open the generated file");
  const auto size = static_cast<std::size_t>(status.st_size);
  if (memory.size() < size + 1) memory.resize(size + 1);
  std::size_t done = 0;
  while (done < size) {
    const ssize_t n = ::read(file, memory.data() + done, size - done);
    if (n <= 0) fail("cannot read the generated file");
    done += static_cast<std::size_t>(n);
  }
  ::close(file);
  std::size_t newlines = 0;
  const char* p = memory.data();
  const char* const end = p + size;
  while ((p = static_cast<const char*>(std::memchr(p, '\n', static_cast<std::size_t>(end - p)))) !=
         nullptr) {
    ++newlines;
    if (++p == end) break;
  }
  return newlines;
}

orv::CfgSession open_session(const std::string& path) {
  orv::CfgSession session(orv::cfg_init(nullptr, 0));
  orv::cfg_set_option(session.get(), orv::kCfgOptConfigFile, path.c_str());
  if (orv::cfg_bind_s(session.get(), nullptr, nullptr, 128) != 0) {
    fail(orv::cfg_dump_exception(session.get()));
  }
  return session;
}

int search(const orv::CfgSession& session, const std::string& base, int scope, const char* filter) {
  orv::_CFGMessage* chain = nullptr;
  const int rc = orv::cfg_search_s(session.get(), base.c_str(), scope, filter, nullptr, 0, &chain);
  if (rc != 0) fail("a search failed with " + std::to_string(rc));
  const orv::CfgResult owned(chain);
  return orv::cfg_count_entries(session.get(), chain);
}

// As a server answers a base search: every attribute with its values.
int search_and_walk(const orv::CfgSession& session, const std::string& base) {
  orv::_CFGMessage* chain = nullptr;
  if (orv::cfg_search_s(session.get(), base.c_str(), 0, "objectclass=*", nullptr, 0, &chain) != 0) {
    fail("a search failed");
  }
  const orv::CfgResult owned(chain);
  orv::_CFGMessage* const entry = orv::cfg_first_entry(session.get(), chain);
  orv::_CFGBer* walk = nullptr;
  orv::CfgText name(orv::cfg_first_attribute(session.get(), entry, &walk));
  const orv::CfgCursor cursor(walk);
  int attributes = 0;
  for (; name != nullptr; ++attributes) {
    const orv::CfgValues values(orv::cfg_get_values(session.get(), entry, name.get()));
    if (values == nullptr) fail("an attribute has no values");
    name.reset(orv::cfg_next_attribute(session.get(), entry, walk));
  }
  return attributes;
}

// ---- Measuring ----

struct Figure {
  std::string name;
  double microseconds = 0;
  double ratio = 0;  // to the floor, measured turn by turn
  double bound = 0;  // the ratio to reach, 0 when there is none
};

struct Work {
  std::string name;
  std::function<void()> run;
  double bound = 0;
};

// Processor time of this thread, in microseconds: all that is measured here is work in memory, and
// what else the machine does meanwhile does not count.
double processor_time() {
  timespec now{};
  ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) * 1e6 + static_cast<double>(now.tv_nsec) / 1e3;
}

double time_of(const std::function<void()>& run) {
  const double start = processor_time();
  run();
  return processor_time() - start;
}

double median(std::vector<double> values) {
  const auto middle = values.begin() + static_cast<std::ptrdiff_t>(values.size() / 2);
  std::nth_element(values.begin(), middle, values.end());
  return *middle;
}

// Measures the works in turn, the floor first in each round, so that noise meets all alike.
std::vector<Figure> measure(const std::vector<Work>& works, double seconds) {
  std::vector<std::vector<double>> times(works.size());
  std::vector<std::vector<double>> ratios(works.size());
  for (const Work& work : works) work.run();
  const auto start = Clock::now();
  for (int round = 0; round < 5 || Clock::now() - start < std::chrono::duration<double>(seconds);
       ++round) {
    for (std::size_t i = 0; i < works.size(); ++i) {
      times[i].push_back(time_of(works[i].run));
      ratios[i].push_back(times[i].back() / times[0].back());
    }
  }
  std::vector<Figure> figures;
  for (std::size_t i = 0; i < works.size(); ++i) {
    figures.push_back({works[i].name, median(times[i]), median(ratios[i]), works[i].bound});
  }
  return figures;
}

std::vector<Figure> measure_configuration(const std::string& path, std::size_t entries,
                                          double seconds) {
  const std::string last = std::to_string(entries - 2);
  const bool last_is_group = (entries - 2) % 50 == 0;
  const std::string base = last_is_group
                               ? "CN=GROUP " + last + ",CN=CONFIGURATION"
                               : "CN=SETTING " + last + ",CN=GROUP " +
                                     std::to_string((entries - 2) / 50 * 50) + ",CN=CONFIGURATION";
  const std::string equality =
      "(orv-slapdAdminDN=cn=member-" + last + ",ou=operations,o=example corporation)";
  const std::string part = "(description=*number " + last + " is*)";
  std::vector<char> memory;
  const auto expect = [](int count, std::size_t expected) {
    if (static_cast<std::size_t>(count) != expected) fail("a search found the wrong entries");
  };
  const orv::CfgSession opened = open_session(path);
  const std::vector<Work> works = {
      {"floor: read and find newlines", [&] { floor_once(path.c_str(), memory); }, 0},
      {"open + base search",
       [&] { expect(search(open_session(path), base, 0, "objectclass=*"), 1); },
       entries == 10000 ? 3.0 : 0.0},
      {"open + base search + walk of the entry",
       [&] { expect(search_and_walk(open_session(path), base), 7); }, 0},
      {"open + subtree search, all entries",
       [&] {
         expect(search(open_session(path), "CN=CONFIGURATION", 2, "(objectclass=*)"), entries);
       },
       0},
      {"open + subtree search, equality filter, one entry",
       [&] { expect(search(open_session(path), "CN=CONFIGURATION", 2, equality.c_str()), 1); }, 0},
      {"base search in an open session",
       [&] { expect(search(opened, base, 0, "objectclass=*"), 1); }, 0},
      {"subtree search in an open session",
       [&] { expect(search(opened, "CN=CONFIGURATION", 2, "(objectclass=*)"), entries); }, 0},
      {"equality filter in an open session",
       [&] { expect(search(opened, "CN=CONFIGURATION", 2, equality.c_str()), 1); }, 0},
      {"substring filter in an open session",
       [&] { expect(search(opened, "CN=CONFIGURATION", 2, part.c_str()), 1); }, 0},
  };
  return measure(works, seconds);
}

// ---- Report ----

void print_table(std::size_t entries, std::size_t bytes, const std::vector<Figure>& figures) {
  std::printf("\n%zu entries, %zu bytes\n", entries, bytes);
  for (const Figure& figure : figures) {
    std::printf("  %-52s %12.1f us %8.2f x floor", figure.name.c_str(), figure.microseconds,
                figure.ratio);
    if (figure.bound > 0) std::printf("   (to reach: %.1f)", figure.bound);
    std::printf("\n");
  }
  std::fflush(stdout);
}

void append_json(std::string& json, std::size_t entries, std::size_t bytes,
                 const std::vector<Figure>& figures) {
  for (const Figure& figure : figures) {
    char line[512];
    std::snprintf(line, sizeof line,
                  "%s  {\"suite\": \"cfg\", \"entries\": %zu, \"bytes\": %zu, \"name\": \"%s\", "
                  "\"microseconds\": %.2f, \"ratio_to_floor\": %.3f, \"to_reach\": %.2f}",
                  json.empty() ? "" : ",\n", entries, bytes, figure.name.c_str(),
                  figure.microseconds, figure.ratio, figure.bound);
    json += line;
  }
}

}  // namespace

int main(int argc, char** argv) {
  std::string json_path;
  double seconds = 2;
  std::vector<std::size_t> sizes = {100, 1000, 10000, 100000};
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string option = argv[i];
    if (option == "--json") json_path = argv[i + 1];
    if (option == "--seconds") seconds = std::stod(argv[i + 1]);
    if (option == "--entries") sizes = orv::bench::read_sizes(argv[i + 1], 3);
  }
  register_types();
  char path[] = "/tmp/bench-cfg-XXXXXX";
  const int file = ::mkstemp(path);
  if (file < 0) fail("cannot make a file for the generated configuration");
  ::close(file);

  std::string json;
  for (const std::size_t entries : sizes) {
    const std::string text = make_configuration(entries);
    std::ofstream(path, std::ios::trunc) << text;
    const std::vector<Figure> figures = measure_configuration(path, entries, seconds);
    print_table(entries, text.size(), figures);
    append_json(json, entries, text.size(), figures);
  }
  ::unlink(path);
  json = "[\n" + json + "\n]\n";
  if (json_path.empty()) {
    std::cout << "\n" << json;
  } else {
    std::ofstream(json_path) << json;
  }
  return 0;
}
