#include "audit/record.h"

#include <algorithm>
#include <ctime>
#include <new>
#include <utility>

#include "cfg/ldif.h"
#include "cfg/masked_dn.h"
#include "cfg/result_codes.h"

namespace orv::server {
namespace {

constexpr std::string_view kDnSyntax = "1.3.6.1.4.1.1466.115.121.1.12";

const SchemaAttribute* find_type(const Schema& schema, std::string_view description) {
  return schema.attribute(description.substr(0, description.find(';')));
}

// False when `dn` is no DN; `shown` is then unchanged.
bool show_dn(std::string_view dn, cfg::UnknownTypes unknown, std::string& shown) {
  const int code = cfg::mask_dn(dn, unknown, shown);
  if (code == result::no_memory) throw std::bad_alloc();
  return code == result::success;
}

// Writes the lines of a change, up to a bound.
class ChangeText {
 public:
  ChangeText(const Schema& schema, AuditDetail detail)
      : schema_(schema), most_(detail == AuditDetail::whole ? std::string::npos : kBriefBytes) {}

  void target(std::string_view dn, std::string_view change_type) {
    name("dn", "# target", dn);
    line("changetype", change_type);
  }

  // A line whose value is a DN. One that is not shown is empty, and a comment says why.
  void name(std::string_view field, std::string_view comment, std::string_view dn) {
    const bool cut = most_ != std::string::npos && dn.size() > most_ - std::min(most_, out_.size());
    std::string shown;
    if (cut || !show_dn(dn, cfg::UnknownTypes::hidden, shown)) {
      line(comment, cut ? "cut, too long" : "not a DN");
      shown.clear();
    }
    line(field, shown);
  }

  void values(const Attribute& attribute) {
    const SchemaAttribute* const type = find_type(schema_, attribute.type);
    for (const std::string& value : attribute.values) this->value(attribute.type, type, value);
  }

  void line(std::string_view name, std::string_view text) {
    cfg::append_ldif_line(out_, name, text);
  }
  // What is left out is said where it was: a delete without values would be one of all of them.
  void end_of_modification() {
    say_what_was_cut();
    out_ += "-\n";
  }

  bool has_room_for(std::size_t bytes) const {
    return most_ == std::string::npos || (out_.size() < most_ && bytes < most_ - out_.size());
  }
  void leave_out_modification() { ++modifications_left_out_; }

  std::string take() {
    say_what_was_cut();
    if (modifications_left_out_ > 0)
      line("# cut", std::to_string(modifications_left_out_) + " modifications are not shown");
    return std::move(out_);
  }

 private:
  void value(const std::string& name, const SchemaAttribute* type, std::string_view value) {
    if (!type || type->secret) {
      if (room_for(name.size())) line(name, cfg::kMask);
      return;
    }
    if (!room_for(name.size() + value.size())) return;
    // Any value may be a DN, whatever the syntax of its type; one that should be and is not, is not
    // looked into.
    std::string shown(value);
    if (!show_dn(value, cfg::UnknownTypes::shown, shown) &&
        (type->syntax == kDnSyntax || cfg::find_secret(value, 0)))
      shown = cfg::kMask;
    line(name, shown);
  }

  void say_what_was_cut() {
    if (left_out_ == 0) return;
    line("# cut", std::to_string(std::exchange(left_out_, 0)) + " values are not shown");
  }

  // What there is no room for is counted.
  bool room_for(std::size_t bytes) {
    const bool room = has_room_for(bytes);
    if (!room) ++left_out_;
    return room;
  }

  const Schema& schema_;
  const std::size_t most_;
  std::string out_;
  std::size_t left_out_ = 0;  // values
  std::size_t modifications_left_out_ = 0;
};

std::string_view modification_name(int operation) {
  if (operation == 0) return "add";
  return operation == 1 ? "delete" : "replace";
}

void append_time(std::string& out, std::chrono::system_clock::time_point when) {
  using std::chrono::microseconds;
  const auto micros = std::chrono::duration_cast<microseconds>(when.time_since_epoch()).count();
  const std::time_t seconds = micros / 1000000;
  std::tm parts{};
  gmtime_r(&seconds, &parts);
  char text[32];
  out.append(text, std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%S.", &parts));
  const std::string fraction = std::to_string(micros % 1000000);
  out.append(6 - std::min<std::size_t>(6, fraction.size()), '0');
  out += fraction;
  out += 'Z';
}

}  // namespace

std::string describe_change(const Schema& schema, const AddRequest& request, AuditDetail detail) {
  ChangeText text(schema, detail);
  text.target(request.dn, "add");
  for (const Attribute& attribute : request.attributes) text.values(attribute);
  return text.take();
}

std::string describe_change(const Schema& schema, const DeleteRequest& request,
                            AuditDetail detail) {
  ChangeText text(schema, detail);
  text.target(request.dn, "delete");
  return text.take();
}

std::string describe_change(const Schema& schema, const ModifyRequest& request,
                            AuditDetail detail) {
  ChangeText text(schema, detail);
  text.target(request.dn, "modify");
  for (const Modification& modification : request.modifications) {
    if (!text.has_room_for(modification.attribute.type.size())) {
      text.leave_out_modification();
      continue;
    }
    text.line(modification_name(modification.operation), modification.attribute.type);
    text.values(modification.attribute);
    text.end_of_modification();
  }
  return text.take();
}

std::string describe_change(const Schema& schema, const ModifyDnRequest& request,
                            AuditDetail detail) {
  ChangeText text(schema, detail);
  text.target(request.dn, "modrdn");
  text.name("newrdn", "# newrdn", request.new_rdn);
  text.line("deleteoldrdn", request.delete_old_rdn ? "1" : "0");
  if (request.new_superior) text.name("newsuperior", "# newsuperior", *request.new_superior);
  return text.take();
}

std::string audit_record(const AuditFacts& facts, std::string_view change) {
  std::string time;
  append_time(time, facts.time);
  std::string record;
  const auto comment = [&record](std::string_view name, std::string_view text) {
    cfg::append_ldif_line(record, name, text);
  };
  comment("# time", time);
  comment("# bind-dn", facts.bound_dn);
  comment("# client", facts.client);
  comment("# connection", std::to_string(facts.connection));
  comment("# message-id", std::to_string(facts.message_id));
  comment("# operation", facts.operation);
  comment("# result",
          facts.code == kNotPerformed ? "none, not performed" : std::to_string(facts.code));
  record += change;
  record += '\n';
  return record;
}

}  // namespace orv::server
