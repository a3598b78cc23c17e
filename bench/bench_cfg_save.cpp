// Durable changes of the configuration file per second, beside the floor measured in the same run:
// writing a file of the same size to a temporary name, flushing it, renaming it over the other and
// flushing the directory.
//
//   bench_cfg_save [--json FILE] [--seconds N] [--entries N[,N...]] [--dir DIR]
//
// A change is what a server does for one: open a session, add, modify or delete one entry, close
// it. Works in DIR (default /var/tmp): a memory file system has no floor to speak of. Adds,
// modifies, deletes and floor take turns, so that the disk's moods meet all alike; figures are
// medians.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <string>
#include <vector>

#include "cfg/attribute_table.h"
#include "cfg/owners.h"
#include "cfg/session.h"
#include "sizes.h"

namespace {

using Clock = std::chrono::steady_clock;

[[noreturn]] void fail(const std::string& what) {
  std::cerr << "bench_cfg_save: " << what << "\n";
  std::exit(1);
}

// ---- The configuration ----

std::string make_configuration(std::size_t entries) {
  std::string text =
      "# A generated configuration.\n\ndn: cn=Configuration\nobjectClass: top\n"
      "objectClass: orv-slapdTop\ncn: Configuration\norv-slapdAdminDN: cn=root\n\n";
  for (std::size_t i = 0; i + 1 < entries; ++i) {
    const std::string id = std::to_string(i);
    text += "dn: cn=Setting " + id + ",cn=Configuration\nobjectClass: top\n";
    text += "objectClass: orv-slapdConfigEntry\ncn: Setting " + id + "\n";
    text += "description: What setting number " + id + " is there for, in a line of words\n";
    text += "orv-slapdAdminDN: cn=member-" + id + ",ou=Operations,o=Example Corporation\n";
    text += "orv-slapdAdminRole: ServerConfigGroupMember\n";
    text += "orv-slapdIpAddress: 192.0.2." + std::to_string(i % 250 + 1) + "\n";
    text += "orv-slapdLog: /var/log/orv/setting-" + id + ".log\n\n";
  }
  return text;
}

// ---- The floor ----

void write_and_flush(const std::string& path, const std::string& text) {
  const int file = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  if (file < 0) fail("cannot make the floor's file");
  for (std::size_t done = 0; done < text.size();) {
    const ssize_t n = ::write(file, text.data() + done, text.size() - done);
    if (n <= 0) fail("cannot write the floor's file");
    done += static_cast<std::size_t>(n);
  }
  if (::fsync(file) != 0) fail("cannot flush the floor's file");
  ::close(file);
}

void floor_once(const std::string& directory, const std::string& text) {
  const std::string path = directory + "/floor.ldif";
  const std::string temporary = path + ".new";
  write_and_flush(temporary, text);
  if (std::rename(temporary.c_str(), path.c_str()) != 0) fail("cannot rename the floor's file");
  const int names = ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (names < 0 || ::fsync(names) != 0) fail("cannot flush the directory");
  ::close(names);
}

// ---- The changes ----

orv::CfgSession open_session(const std::string& path) {
  orv::CfgSession session(orv::cfg_init(nullptr, 0));
  orv::cfg_set_option(session.get(), orv::kCfgOptConfigFile, path.c_str());
  orv::cfg_set_option(session.get(), orv::kCfgOptSaveFile, (path + ".save").c_str());
  if (orv::cfg_bind_s(session.get(), nullptr, nullptr, 128) != 0) {
    fail(orv::cfg_dump_exception(session.get()));
  }
  return session;
}

constexpr const char* kDn = "cn=new,cn=Configuration";

void add_once(const std::string& path) {
  char cn[] = "cn";
  char name[] = "new";
  char description[] = "description";
  char text[] = "An entry that comes and goes";
  char* names[] = {name, nullptr};
  char* texts[] = {text, nullptr};
  orv::ldapmod first{orv::kModAdd, cn, {names}, nullptr};
  orv::ldapmod second{orv::kModAdd, description, {texts}, nullptr};
  orv::ldapmod* mods[] = {&first, &second, nullptr};
  const int rc = orv::cfg_add_s(open_session(path).get(), kDn, mods);
  if (rc != 0) fail("an add failed with " + std::to_string(rc));
}

// Another value of one attribute each time.
void modify_once(const std::string& path) {
  static int times = 0;
  char description[] = "description";
  std::string text = "An entry that was changed " + std::to_string(++times) + " times";
  char* texts[] = {text.data(), nullptr};
  orv::ldapmod mod{orv::kModReplace, description, {texts}, nullptr};
  orv::ldapmod* mods[] = {&mod, nullptr};
  const int rc = orv::cfg_modify_s(open_session(path).get(), kDn, mods);
  if (rc != 0) fail("a modify failed with " + std::to_string(rc));
}

void delete_once(const std::string& path) {
  const int rc = orv::cfg_delete_s(open_session(path).get(), kDn);
  if (rc != 0) fail("a delete failed with " + std::to_string(rc));
}

// ---- Measuring ----

template <class Run>
double milliseconds(Run run) {
  const auto start = Clock::now();
  run();
  return std::chrono::duration<double, std::milli>(Clock::now() - start).count();
}

double median(std::vector<double> values) {
  const auto middle = values.begin() + static_cast<std::ptrdiff_t>(values.size() / 2);
  std::nth_element(values.begin(), middle, values.end());
  return *middle;
}

struct Figures {
  std::vector<double> floor;
  std::vector<double> add;
  std::vector<double> modify;
  std::vector<double> remove;
};

Figures measure(const std::string& directory, const std::string& text, double seconds) {
  const std::string path = directory + "/config.ldif";
  write_and_flush(path, text);
  floor_once(directory, text);
  add_once(path);
  delete_once(path);
  Figures figures;
  const auto end = Clock::now() + std::chrono::duration<double>(seconds);
  while (figures.floor.size() < 10 || Clock::now() < end) {
    figures.floor.push_back(milliseconds([&] { floor_once(directory, text); }));
    figures.add.push_back(milliseconds([&] { add_once(path); }));
    figures.floor.push_back(milliseconds([&] { floor_once(directory, text); }));
    figures.modify.push_back(milliseconds([&] { modify_once(path); }));
    figures.floor.push_back(milliseconds([&] { floor_once(directory, text); }));
    figures.remove.push_back(milliseconds([&] { delete_once(path); }));
  }
  return figures;
}

void report(std::string& json, const char* name, std::size_t entries, std::size_t bytes,
            double time, double floor) {
  std::printf("  %-40s %10.3f ms %10.1f a second %8.2f x floor\n", name, time, 1000 / time,
              time / floor);
  char line[256];
  std::snprintf(line, sizeof line,
                "%s  {\"suite\": \"cfg_save\", \"entries\": %zu, \"bytes\": %zu, \"name\": \"%s\", "
                "\"milliseconds\": %.4f, \"ratio_to_floor\": %.3f, \"to_reach\": 1.5}",
                json.empty() ? "" : ",\n", entries, bytes, name, time, time / floor);
  json += line;
}

}  // namespace

int main(int argc, char** argv) {
  std::string json_path;
  std::string parent = "/var/tmp";
  double seconds = 3;
  std::vector<std::size_t> sizes = {100, 10000};
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string option = argv[i];
    if (option == "--json") json_path = argv[i + 1];
    if (option == "--seconds") seconds = std::stod(argv[i + 1]);
    if (option == "--entries") sizes = orv::bench::read_sizes(argv[i + 1], 1);
    if (option == "--dir") parent = argv[i + 1];
  }
  std::string json;
  for (const std::size_t entries : sizes) {
    std::string directory = parent + "/bench-cfg-save-XXXXXX";
    if (::mkdtemp(directory.data()) == nullptr) fail("cannot make a directory in " + parent);
    const std::string text = make_configuration(entries);
    const Figures figures = measure(directory, text, seconds);
    const double floor = median(figures.floor);
    std::printf("\n%zu entries, %zu bytes, %zu rounds\n", entries, text.size(), figures.add.size());
    report(json, "floor", entries, text.size(), floor, floor);
    report(json, "add", entries, text.size(), median(figures.add), floor);
    report(json, "modify", entries, text.size(), median(figures.modify), floor);
    report(json, "delete", entries, text.size(), median(figures.remove), floor);
    std::fflush(stdout);
    for (const char* name : {"config.ldif", "config.ldif.save", "config.ldif.lock", "floor.ldif"}) {
      ::unlink((directory + "/" + name).c_str());
    }
    ::rmdir(directory.c_str());
  }
  json = "[\n" + json + "\n]\n";
  if (json_path.empty()) {
    std::cout << "\n" << json;
  } else {
    std::ofstream(json_path) << json;
  }
  return 0;
}
