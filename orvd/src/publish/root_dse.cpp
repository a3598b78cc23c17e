#include "publish/root_dse.h"

#include "publish/entry_builder.h"
#include "slapi/control.h"

namespace orv::server {

EntryPtr make_root_dse(const ServerFacts& facts) noexcept {
  try {
    return EntryBuilder("", "")
        .add("objectClass", "top")
        .add("namingContexts", facts.naming_contexts)
        .add("subschemaSubentry", kSubschemaDn)
        .add("supportedControl", slapi_supported_controls())
        .add("supportedExtension", facts.supported_extensions)
        .add("supportedFeatures", facts.supported_features)
        .add("supportedLDAPVersion", "3")
        .add("supportedSASLMechanisms", facts.sasl_mechanisms)
        .add("orv-restartSettings", facts.restart_settings)
        .add("vendorName", facts.vendor_name)
        .add("vendorVersion", facts.vendor_version)
        .take();
  } catch (...) {
    return nullptr;
  }
}

}  // namespace orv::server
