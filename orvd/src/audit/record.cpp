#include "audit/record.h"

#include <algorithm>
#include <ctime>
#include <vector>

#include "cfg/dn.h"
#include "cfg/ldif.h"
#include "cfg/result_codes.h"

namespace orv::server {
namespace {

constexpr std::string_view kMask = "********";
constexpr std::string_view kDnSyntax = "1.3.6.1.4.1.1466.115.121.1.12";

const SchemaAttribute* find_type(const Schema& schema, std::string_view description) {
  return schema.attribute(description.substr(0, description.find(';')));
}

bool is_secret(const Schema& schema, const cfg::Ava& part) {
  const SchemaAttribute* const type = find_type(schema, part.type);
  return type && type->secret;
}

bool holds_secret(const Schema& schema, const cfg::Dn& dn) {
  return std::any_of(dn.begin(), dn.end(), [&](const cfg::Rdn& rdn) {
    return std::any_of(rdn.begin(), rdn.end(),
                       [&](const cfg::Ava& part) { return is_secret(schema, part); });
  });
}

// A value as it may stand in a DN: everything that might mean something there as \XX.
void append_rdn_value(std::string& out, std::string_view value) {
  constexpr char kHex[] = "0123456789ABCDEF";
  for (const char c : value) {
    const bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                       c == '-' || c == '.' || c == '_' || c == '@' || c == '/' || c == ':';
    if (plain) {
      out += c;
      continue;
    }
    const auto byte = static_cast<unsigned char>(c);
    out += {'\\', kHex[byte >> 4], kHex[byte & 15]};
  }
}

std::string rewritten(const Schema& schema, const cfg::Dn& dn) {
  std::string text;
  for (const cfg::Rdn& rdn : dn) {
    for (const cfg::Ava& part : rdn) {
      if (&part != &rdn.front()) text += '+';
      text += part.type;
      text += '=';
      if (is_secret(schema, part))
        text += kMask;
      else
        append_rdn_value(text, part.value);
    }
    if (&rdn != &dn.back()) text += ',';
  }
  return text;
}

// Writes the lines of a change, up to a bound.
class ChangeText {
 public:
  ChangeText(const Schema& schema, AuditDetail detail)
      : schema_(schema), most_(detail == AuditDetail::whole ? std::string::npos : kBriefBytes) {}

  void target(std::string_view dn, std::string_view change_type) {
    std::string shown;
    if (dn.size() > most_ || !mask_dn(schema_, dn, shown)) {
      line("# target", dn.size() > most_ ? "cut, too long" : "not a DN");
      shown.clear();
    }
    line("dn", shown);
    line("changetype", change_type);
  }

  void values(const Attribute& attribute) {
    const SchemaAttribute* const type = find_type(schema_, attribute.type);
    for (const std::string& value : attribute.values) this->value(attribute.type, type, value);
  }

  void line(std::string_view name, std::string_view text) {
    cfg::append_ldif_line(out_, name, text);
  }
  void end_of_modification() { out_ += "-\n"; }

  // Whether something more may be written; what may not is counted.
  bool room_for(std::size_t bytes) {
    if (most_ == std::string::npos || (out_.size() < most_ && bytes < most_ - out_.size()))
      return true;
    ++left_out_;
    return false;
  }

  std::string take() {
    if (left_out_ > 0) line("# cut", std::to_string(left_out_) + " values are not shown");
    return std::move(out_);
  }

 private:
  void value(const std::string& name, const SchemaAttribute* type, std::string_view value) {
    if (!type || type->secret) {
      if (room_for(name.size())) line(name, kMask);
      return;
    }
    if (!room_for(name.size() + value.size())) return;
    // Any value may be a DN, whatever the syntax of its type; one that should be and is not, is not
    // looked into.
    std::string shown(value);
    const bool is_dn = mask_dn(schema_, value, shown);
    line(name, is_dn || type->syntax != kDnSyntax ? std::string_view(shown) : kMask);
  }

  const Schema& schema_;
  const std::size_t most_;
  std::string out_;
  std::size_t left_out_ = 0;
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

bool mask_dn(const Schema& schema, std::string_view dn, std::string& shown) {
  cfg::Dn parsed;
  if (cfg::parse_dn(dn, parsed) != result::success) return false;
  shown = holds_secret(schema, parsed) ? rewritten(schema, parsed) : std::string(dn);
  return true;
}

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
    if (!text.room_for(modification.attribute.type.size())) continue;
    text.line(modification_name(modification.operation), modification.attribute.type);
    text.values(modification.attribute);
    text.end_of_modification();
  }
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
