// Modifications whose order cannot matter.
//
// The backend checks a list of modifications in the client's order, but writes it grouped by type
// and code, and some of its rules look only at the first modification of a type. So it is handed
// only lists for which all of this comes to the same: types in the order in which the client first
// named them, and for each type one modification, or an add and behind it a delete with no value in
// common.
//
//   the client's modifications of one type         what is handed over
//   add a, delete b, add c                         add {a, c}, delete {b}
//   delete all                                     delete all
//   delete all, then others                        replace with what is left
//   replace, then others                           replace with what is left
//   values added or deleted, and then all          refused with 53: whether the first part would
//     deleted or replaced                            have succeeded would be forgotten
//   a value added that is deleted, or the reverse  refused with 53
//   roles deleted one by one, and other types      refused with 53: the rule on roles counts, and
//     deleted or replaced behind them                would not see that they are not the member's
//
// What an entry holds after a folded list is what it would hold after the client's own, and a list
// that would have failed fails. There is one exception: a delete of all with others behind it no
// longer fails where the entry has nothing to delete.
//
// Values are compared by the equality of their type, passwords as the client sent them.
//
// Functions without state; they throw std::bad_alloc.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "ops/refusal.h"
#include "slapi/schema.h"

namespace orv::server {

struct TypeChange {
  int operation = 0;      // kModAdd, kModDelete or kModReplace
  std::string_view type;  // canonical; lives in the schema
  std::vector<std::string> values;
};
using TypeChanges = std::vector<TypeChange>;

// Folds a list as the table above says. 0; 20 a value is added or deleted twice, or is given twice
// in one modification, or is added to values that the list itself has put there; 16 a value is
// deleted that the list itself has taken away; 53 the list cannot be folded. `folded` is empty
// after a refusal, and to be wiped by the caller: it may hold passwords.
Refusal fold_changes(const Schema& schema, const TypeChanges& given, TypeChanges& folded);

// 69 unless all that is done to objectClass is to add and delete auxiliary classes. The rules
// recognise entries by their structural classes: whoever could change those could make an ordinary
// entry one that somebody binds by, or hide one from the rules.
Refusal check_class_changes(const Schema& schema, const TypeChanges& changes);

// 67 when a folded list would take away a value that the entry's RDN consists of. `dn` is the
// target as the client spelled it.
Refusal check_name_stays(const Schema& schema, std::string_view dn, const TypeChanges& folded);

}  // namespace orv::server
