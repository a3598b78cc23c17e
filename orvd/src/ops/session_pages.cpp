// Searches whose answers a client fetches in pages.
#include <algorithm>
#include <new>
#include <utility>

#include "cfg/result_codes.h"
#include "ops/request_text.h"
#include "ops/session.h"

namespace orv::server {

PagedSearches::Limits Session::page_limits() const noexcept {
  return {settings().max_paged_searches, settings().max_paged_result_size};
}

// The search is made whole. RFC 2696, 3: with a size limit within the first page there are no
// others, and the control means nothing.
void Session::prepare_pages(PendingOperation& operation, const SearchRequest& request,
                            std::string_view normal_base, const PagedResultsControl& control) {
  AnswerLimits limits = operation.answer().limits();
  if (limits.entries > 0 && control.size >= limits.entries) return;
  operation.page = control;
  operation.page_key = paged_search_key(request, normal_base);
  limits.bytes = std::min(limits.bytes, static_cast<std::size_t>(page_limits().bytes));
  operation.answer().set_limits(limits);
}

// What is beyond the first page is kept. Its failure, if it ended with one, comes with the last.
Session::Delivered Session::first_page(PendingOperation& operation) {
  Answer& answer = operation.answer();
  FoundEntries found(answer.bytes(), answer.entries(), answer.code());
  std::string out;
  const Delivered page = make_page(answer.message_id(), operation.page->size,
                                   std::move(operation.page_key), std::move(found), out);
  output_.queued(out.size());
  transmit(out);
  return page;
}

Session::Delivered Session::make_page(std::int32_t id, std::int64_t size, std::string key,
                                      FoundEntries found, std::string& out) {
  const std::int64_t before = found.left();
  if (!found.append_entries(out, size, id)) throw std::bad_alloc();
  const std::int64_t sent = before - found.left();
  if (found.left() == 0 || size == 0) {
    if (!found.append_result(out, id)) throw std::bad_alloc();
    return {found.code(), sent};
  }
  found.shrink();
  const std::int64_t total = found.total();
  std::string cookie;
  if (pages_.keep(std::move(key), std::move(found), page_limits(), cookie) ==
      PagedSearches::Kept::yes) {
    if (!append_page_result(out, id, total, cookie)) throw std::bad_alloc();
    return {result::success, sent};
  }
  ResultAnswer refusal{};
  refusal.message_id = id;
  refusal.response_tag = tag::search_done;
  refusal.code = result::busy;
  refusal.text = "too many paged results are kept";
  out.clear();
  if (!encode_result(out, refusal)) throw std::bad_alloc();
  return {result::busy, 0};
}

// Another page of a search, or with size 0 its end.
void Session::next_page(std::int32_t id, const SearchRequest& request, std::string_view normal_base,
                        const PagedResultsControl& control) {
  const Clock::time_point started = Clock::now();
  std::string what;
  if (services_.logs.access_enabled()) {
    what = describe_search(services_.schema, request, normal_base) + " page=";
    append_number(what, control.size);
    what += " next";
  }
  std::string key = paged_search_key(request, normal_base);
  FoundEntries found;
  if (!pages_.take(control.cookie, key, found))
    return respond(id, tag::search_done, result::unwilling_to_perform,
                   "the cookie is not one that this search can go on with", what);
  std::string out;
  Delivered page{result::success, 0};
  if (control.size > 0)
    page = make_page(id, control.size, std::move(key), std::move(found), out);
  else if (!append_page_result(out, id, found.total(), ""))
    throw std::bad_alloc();
  const std::size_t bytes = out.size();
  output_.answered(bytes);
  output_.queued(bytes);
  transmit(out);
  output_.settled(bytes);
  log_result(id, what, page.code, page.entries, started);
}

}  // namespace orv::server
