#include "publish/root_dse.h"

#include <algorithm>

#include "publish/entry_builder.h"
#include "slapi/control.h"

namespace orv::server {

EntryPtr make_root_dse(const ServerFacts& facts) noexcept {
  try {
    std::vector<std::string> controls = slapi_supported_controls();
    std::erase_if(controls, [&off = facts.controls_off](const std::string& oid) {
      return std::find(off.begin(), off.end(), oid) != off.end();
    });
    return EntryBuilder("", "")
        .add("objectClass", "top")
        .add("namingContexts", facts.naming_contexts)
        .add("subschemaSubentry", kSubschemaDn)
        .add("supportedControl", controls)
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
