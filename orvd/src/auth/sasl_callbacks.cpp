#include "auth/sasl_callbacks.h"

#include <cstring>

namespace orv::server {
namespace {

SaslClaimant& claimant_of(void* context) noexcept {
  return *static_cast<SaslClaimant*>(context);
}

// Tells who is meant, and hands the name on as it is.
int take_name(sasl_conn_t*, void* context, const char* name, unsigned length, unsigned flags,
              const char*, char* out, unsigned out_size, unsigned* out_length) {
  if (length >= out_size) return SASL_BADPROT;
  const std::string_view text(name, length);
  int code = SASL_OK;
  if ((flags & SASL_CU_AUTHID) != 0)
    code = claimant_of(context).claim_name(text);
  else if ((flags & SASL_CU_AUTHZID) != 0)
    code = claimant_of(context).claim_authorization(text);
  if (code != SASL_OK) return code;
  std::memmove(out, name, length);
  out[length] = '\0';
  *out_length = length;
  return SASL_OK;
}

// Whether somebody may act as somebody is decided when the exchange is done.
int leave_policy_open(sasl_conn_t*, void*, const char*, unsigned, const char*, unsigned,
                      const char*, unsigned, struct propctx*) {
  return SASL_OK;
}

int look_up(void*, sasl_server_params_t* parameters, unsigned flags, const char*, unsigned) {
  if ((flags & SASL_AUXPROP_AUTHZID) != 0) return SASL_OK;
  const sasl_utils_t& utils = *parameters->utils;
  int (*function)() = nullptr;
  void* context = nullptr;
  const int found = utils.getcallback(utils.conn, SASL_CB_CANON_USER, &function, &context);
  if (found != SASL_OK || context == nullptr) return SASL_FAIL;
  const propval* const wanted = utils.prop_get(parameters->propctx);
  for (const propval* property = wanted; property != nullptr && property->name != nullptr;
       ++property)
    if (std::strcmp(property->name, kPasswordProperty) == 0)
      return utils.prop_set(parameters->propctx, kPasswordProperty, claimant_of(context).password(),
                            0);
  return SASL_OK;
}

}  // namespace

SaslCallbacks callbacks_of(SaslClaimant& claimant) noexcept {
  return {sasl_callback_of(SASL_CB_CANON_USER, take_name, &claimant),
          sasl_callback_of(SASL_CB_PROXY_POLICY, leave_policy_open, &claimant),
          {SASL_CB_LIST_END, nullptr, nullptr}};
}

int init_password_source(const sasl_utils_t*, int max_version, int* version,
                         sasl_auxprop_plug_t** plugin, const char*) {
  static char name[] = "orvd";
  static sasl_auxprop_plug_t source{0, 0, nullptr, nullptr, look_up, name, nullptr};
  if (max_version < SASL_AUXPROP_PLUG_VERSION) return SASL_BADVERS;
  *version = SASL_AUXPROP_PLUG_VERSION;
  *plugin = &source;
  return SASL_OK;
}

}  // namespace orv::server
