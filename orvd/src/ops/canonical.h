// One spelling: what a client wrote is brought to the form in which the backend compares bytes, or
// refused.
//
// DNs are normalised, attribute types and object class values take their canonical schema names,
// attribute options are refused, values with NUL bytes or invalid UTF-8 are refused. Everything
// that is handed to a handler is from the malloc family.
//
// Nothing here throws but std::bad_alloc; all functions are thread-safe.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "cfg/ldapmod.h"
#include "ops/refusal.h"
#include "protocol/message.h"
#include "slapi/owners.h"
#include "slapi/schema.h"

namespace orv::server {

// A null-terminated array of malloced texts.
struct TextArrayDeleter {
  void operator()(char** array) const noexcept { charray_free(array); }
};
using TextArray = std::unique_ptr<char*, TextArrayDeleter>;

// A linked list of modification records with everything in them; null is a no-op.
void free_modifications(ldapmod* first) noexcept;

// A malloced copy. Throws std::bad_alloc.
MallocText malloc_text(std::string_view text);

// The names that a search asked for, canonical where the schema knows them; null for an empty list.
// Names that it does not know stay as they are: no entry has them.
TextArray canonical_names(const Schema& schema, const std::vector<std::string>& names);

// The entry of an add request: canonical types, each once, object classes first, the values of the
// RDN completed. 34 no DN; 17 unknown type or an attribute option; 2 an attribute without values or
// an empty list; 19 an attribute that only the server sets; 20 a type twice, or a value by the
// type's own equality; 21 a value that must not reach the backend, or that the code page of the
// file cannot hold; 64 a password in the RDN.
Refusal make_entry(const Schema& schema, const AddRequest& request, EntryPtr& made);

// Whether a list of modifications is brought to the form in which its order cannot matter
// (ops/modification_list.h), with the checks that need it. Lists of callers who may only send one
// kind of list are not: there the number of modifications is itself a rule of the backend.
enum class ListForm { folded, as_sent };

// The modification records of a modify request, in the order of the client or that of the folded
// list: counted values, a null array where there are none. 17, 19, 20 and 21 as above; 2 an empty
// list, or an add without values. Folded ones also 16, 20, 53, 67 and 69.
Refusal make_modifications(const Schema& schema, const ModifyRequest& request, ListForm form,
                           ldapmod*& first);

// Whether the target of a delete or a modify can be named to the backend: 34 for a DN outside ASCII
// when the file is not in UTF-8. The backend looks at such a name in one code page and changes the
// entry of the name in the other.
Refusal check_target_code_page(std::string_view normal_dn);

// What to do with an assertion on the value of an attribute. Evaluated ones ask for object classes
// under their canonical names.
enum class FilterUse {
  evaluate,                     // by somebody who sees everything
  evaluate_for_administrators,  // hidden from everybody but the primary administrator: Undefined
  show,                         // for a log: values that may be secret are replaced by asterisks
};

// Rewrites the items of a filter (in the decoder's text form), item by item, leaving presence
// tests.
std::string rewrite_filter(const Schema& schema, std::string_view filter, FilterUse use);

}  // namespace orv::server
