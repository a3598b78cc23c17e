#include "ops/modification_list.h"

#include <algorithm>
#include <memory>
#include <new>
#include <unordered_map>

#include "cfg/dn.h"
#include "cfg/ldapmod.h"
#include "cfg/result_codes.h"
#include "cfg/secret.h"
#include "ops/equality.h"

namespace orv::server {
namespace {

constexpr std::string_view kObjectClass = "objectClass";
constexpr std::string_view kRole = "orv-slapdAdminRole";

constexpr std::string_view kTwice = "the same value twice";
constexpr std::string_view kIsThere = "a value is added that is there already";
constexpr std::string_view kIsGone = "a value is deleted that is not there any more";
constexpr std::string_view kAddedAndDeleted =
    "one request cannot both add and delete the same value";
constexpr std::string_view kLateReplace =
    "one request cannot add or delete values and then replace or delete all of them";
constexpr std::string_view kRolesAlone =
    "one request cannot delete roles and then delete or replace values of other attributes";
constexpr std::string_view kClasses = "only auxiliary object classes can be added or deleted";
constexpr std::string_view kName = "a value of the entry's name cannot be taken away";

Refusal refuse(int code, std::string_view what, std::string_view type) {
  return {code, std::string(what).append(": ").append(type)};
}

// ---- folding

// Values in their order, without equal ones. What it holds is wiped with it.
class ValueSet {
 public:
  ValueSet() = default;
  ValueSet(const ValueSet&) = delete;
  ValueSet& operator=(const ValueSet&) = delete;
  ~ValueSet() { clear(); }

  bool empty() const noexcept { return items_.empty(); }
  bool contains(const std::string& key) const { return items_.find(key) != items_.end(); }

  // False when an equal one is there.
  bool insert(const std::string& key, const std::string& value) {
    const auto [item, is_new] = items_.try_emplace(key);
    if (!is_new) return false;
    item->second.number = next_++;
    item->second.value = value;
    return true;
  }

  bool erase(const std::string& key) {
    auto node = items_.extract(key);
    if (node.empty()) return false;
    cfg::wipe(node.key());
    cfg::wipe(node.mapped().value);
    return true;
  }

  void clear() noexcept {
    while (!items_.empty()) {
      auto node = items_.extract(items_.begin());
      cfg::wipe(node.key());
      cfg::wipe(node.mapped().value);
    }
  }

  std::vector<std::string> values() const {
    std::vector<const Item*> items;
    items.reserve(items_.size());
    for (const auto& [key, item] : items_) items.push_back(&item);
    std::sort(items.begin(), items.end(),
              [](const Item* a, const Item* b) { return a->number < b->number; });
    std::vector<std::string> values;
    values.reserve(items.size());
    for (const Item* item : items) values.push_back(item->value);
    return values;
  }

 private:
  struct Item {
    std::size_t number = 0;
    std::string value;
  };
  std::unordered_map<std::string, Item> items_;
  std::size_t next_ = 0;
};

// The modifications of one type while they are taken in, in the client's order.
class TypeFold {
 public:
  TypeFold(const Schema& schema, std::string_view type) : schema_(schema), type_(type) {}

  Refusal take(const TypeChange& change) {
    const bool whole = change.operation == kModReplace || change.values.empty();
    if (whole) return take_whole(change);
    const bool adds = change.operation == kModAdd;
    if (known_ == Known::nothing)
      return adds ? change_unknown(change, added_, deleted_)
                  : change_unknown(change, deleted_, added_);
    known_ = Known::values;
    return adds ? add_to_known(change) : delete_from_known(change);
  }

  std::string_view type() const noexcept { return type_; }
  bool deletes_values() const noexcept { return known_ == Known::nothing && !deleted_.empty(); }
  bool takes_away() const noexcept { return known_ != Known::nothing || !deleted_.empty(); }

  void hand_over(TypeChanges& folded) const {
    if (known_ == Known::emptied) {
      folded.push_back({kModDelete, type_, {}});
    } else if (known_ == Known::values) {
      folded.push_back({kModReplace, type_, added_.values()});
    } else {
      if (!added_.empty()) folded.push_back({kModAdd, type_, added_.values()});
      if (!deleted_.empty()) folded.push_back({kModDelete, type_, deleted_.values()});
    }
  }

 private:
  // What the list so far says about the values of the type.
  enum class Known {
    nothing,  // only which were added and deleted
    emptied,  // one delete of all, and nothing else
    values,   // that they are those of `added_`
  };

  // A replace, or a delete of all.
  Refusal take_whole(const TypeChange& change) {
    const bool replaces = change.operation == kModReplace;
    if (known_ == Known::nothing && !(added_.empty() && deleted_.empty()))
      return refuse(result::unwilling_to_perform, kLateReplace, type_);
    if (!replaces && known_ != Known::nothing && added_.empty())
      return refuse(result::no_such_attribute, kIsGone, type_);
    const bool only_deleted = !replaces && known_ == Known::nothing;
    known_ = only_deleted ? Known::emptied : Known::values;
    added_.clear();
    return insert_all(change, added_, kTwice);
  }

  Refusal change_unknown(const TypeChange& change, ValueSet& same, const ValueSet& opposite) {
    return each(change, [&](const std::string& key, const std::string& value) -> Refusal {
      if (opposite.contains(key))
        return refuse(result::unwilling_to_perform, kAddedAndDeleted, type_);
      if (!same.insert(key, value)) return refuse(result::attribute_or_value_exists, kTwice, type_);
      return {};
    });
  }

  Refusal add_to_known(const TypeChange& change) { return insert_all(change, added_, kIsThere); }

  Refusal delete_from_known(const TypeChange& change) {
    return each(change, [&](const std::string& key, const std::string&) -> Refusal {
      if (!added_.erase(key)) return refuse(result::no_such_attribute, kIsGone, type_);
      return {};
    });
  }

  Refusal insert_all(const TypeChange& change, ValueSet& set, std::string_view reason) {
    return each(change, [&](const std::string& key, const std::string& value) -> Refusal {
      if (!set.insert(key, value)) return refuse(result::attribute_or_value_exists, reason, type_);
      return {};
    });
  }

  template <typename Take>
  Refusal each(const TypeChange& change, Take take) const {
    for (const std::string& value : change.values) {
      struct Key {
        ~Key() { cfg::wipe(text); }
        std::string text;
      } const key{equality_key(schema_, type_, value)};
      if (Refusal refusal = take(key.text, value)) return refusal;
    }
    return {};
  }

  const Schema& schema_;
  const std::string_view type_;
  Known known_ = Known::nothing;
  ValueSet added_;    // or the values, where they are known
  ValueSet deleted_;  // only where they are not
};

using TypeFolds = std::vector<std::unique_ptr<TypeFold>>;

// The rule on roles counts the values that are deleted and looks for the last one only. That all of
// them are the member's is found by the trial on a copy, which forgets a failure at the next delete
// or replace that succeeds: together the two would take all roles away for a list that must fail.
bool loses_count_of_roles(const TypeFolds& folds) {
  const auto roles = std::find_if(folds.begin(), folds.end(), [](const auto& fold) {
    return fold->type() == kRole && fold->deletes_values();
  });
  return roles != folds.end() &&
         std::any_of(roles + 1, folds.end(), [](const auto& fold) { return fold->takes_away(); });
}

// ---- names

// Names ignore the case of letters whatever the type's own equality says.
std::string name_key(const std::string& value) {
  return equality_key(cfg::MatchingRule::case_ignore, value);
}

bool holds(const TypeChange& change, const std::string& key) {
  return std::any_of(change.values.begin(), change.values.end(),
                     [&](const std::string& value) { return name_key(value) == key; });
}

bool takes_away(const TypeChange& change, const std::string& key) {
  if (change.operation == kModAdd) return false;
  if (change.operation == kModReplace) return !holds(change, key);
  return change.values.empty() || holds(change, key);
}

}  // namespace

Refusal fold_changes(const Schema& schema, const TypeChanges& given, TypeChanges& folded) {
  TypeFolds folds;
  std::unordered_map<std::string_view, TypeFold*> by_type;
  for (const TypeChange& change : given) {
    TypeFold*& fold = by_type[change.type];
    if (!fold) {
      folds.push_back(std::make_unique<TypeFold>(schema, change.type));
      fold = folds.back().get();
    }
    if (Refusal refusal = fold->take(change)) return refusal;
  }
  if (loses_count_of_roles(folds)) return refuse(result::unwilling_to_perform, kRolesAlone, kRole);
  folded.reserve(2 * folds.size());  // what moves leaves passwords behind
  for (const auto& fold : folds) fold->hand_over(folded);
  return {};
}

Refusal check_class_changes(const Schema& schema, const TypeChanges& changes) {
  for (const TypeChange& change : changes) {
    if (change.type != kObjectClass) continue;
    bool allowed = change.operation != kModReplace && !change.values.empty();
    for (const std::string& value : change.values) {
      const ObjectClass* const known = schema.object_class(value);
      if (!known || known->kind != ClassKind::auxiliary) allowed = false;
    }
    if (!allowed) return refuse(result::object_class_mods_prohibited, kClasses, kObjectClass);
  }
  return {};
}

Refusal check_name_stays(const Schema& schema, std::string_view dn, const TypeChanges& folded) {
  cfg::Dn parsed;
  const int code = cfg::parse_dn(dn, parsed);
  if (code == result::no_memory) throw std::bad_alloc();
  if (code != result::success || parsed.empty()) return {};
  for (const cfg::Ava& ava : parsed.front()) {
    const std::string_view type = schema.canonical_attribute(ava.type);
    const std::string key = name_key(ava.value);
    for (const TypeChange& change : folded)
      if (change.type == type && takes_away(change, key))
        return refuse(result::not_allowed_on_rdn, kName, type);
  }
  return {};
}

}  // namespace orv::server
