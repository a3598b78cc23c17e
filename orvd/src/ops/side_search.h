// A search of one entry that is made for a client on the way of another operation of its own, to
// test an assertion or to copy the entry: with the client's rights, by the backend's own handler,
// so that it shows what a search by that client would show and nothing else.
//
// Threads: made on the connection's thread; run by whoever holds the gate.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "ops/answer.h"
#include "ops/canonical.h"
#include "ops/services.h"

namespace orv::server {

class SideSearch {
 public:
  // `client`: the operation that it is for. `filter` is as clients send it, in the decoder's text
  // form; `attributes` likewise, `bytes` bounds the entry. Throws std::bad_alloc.
  SideSearch(Services& services, Connection& connection, const Operation& client,
             std::string_view normal_dn, std::string_view filter,
             const std::vector<std::string>& attributes, std::size_t bytes);
  SideSearch(const SideSearch&) = delete;
  SideSearch& operator=(const SideSearch&) = delete;

  // The entry may have no more bytes than this either. Before run().
  void bound(std::size_t bytes) noexcept;

  // The result code of the search. Only inside the gate.
  int run(BackendHost& backend) noexcept;

  // After run(): whether an entry was found and shown.
  bool found() const noexcept { return answer_.entries() > 0; }

  // After run(): the entry found as a SearchResultEntry (RFC 4511, 4.5.2); one with a name and
  // nothing else when none was shown. Throws std::bad_alloc.
  std::string shown_entry();

 private:
  Connection& connection_;
  Operation operation_;
  Answer answer_;
  PblockPtr parameters_;
  MallocText dn_;
  MallocText filter_;
  TextArray names_;
};

// Whether a client may search at all: what it may not search it may not ask about on the way of
// other operations either.
bool may_search(unsigned authority) noexcept;

// A filter in the form in which it is evaluated for a client with these flags. Throws
// std::bad_alloc.
std::string filter_for(const Schema& schema, std::string_view filter, unsigned authority);

// Tests an assertion of somebody with these flags on an entry that is to be added, with canonical
// types and in UTF-8: 0 when it is true, 122 when not, 3 interrupted (cfg/interrupt.h), 90. Values
// of passwords match nothing. It may take as long as the filter's items times the entry's values,
// so not on a connection's thread.
int test_assertion(const Schema& schema, const entry& added, std::string_view filter,
                   unsigned authority) noexcept;

}  // namespace orv::server
