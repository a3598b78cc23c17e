// What ties the two ends of an add together: the entry that passed the schema check, and the list
// that is written for it.
//
// A backend translates the attributes in between and ends its list early when memory runs out for
// an attribute, without saying so. Written, that would be half an entry that the client believes
// whole. The translated list shares the type texts of the entry, so that it can be told apart from
// any other.
#pragma once

#include "slapi/entry.h"

namespace orv::slapi {

// Remembers, for this thread, how many attributes the entry has.
void note_checked_entry(const entry& e) noexcept;

// Whether `attributes` is the beginning of the list of the entry noted last on this thread, and not
// the whole of it. Forgets that entry.
bool is_cut_short(const attr* attributes) noexcept;

}  // namespace orv::slapi
