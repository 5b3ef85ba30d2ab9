// Every store's cases, over WebDAV to a server in this process.
#include "dav_front_store.h"

namespace {

template <typename Store>
StoreKind kind(const char *name) {
  return {name, []() -> std::unique_ptr<TestStore> { return std::make_unique<Store>(); }};
}

INSTANTIATE_TEST_SUITE_P(Store, Conformance,
                         ::testing::Values(kind<DavFrontStore>("Dav"),
                                           kind<DavInPlaceStore>("DavInPlace")),
                         [](const auto &info) { return std::string(info.param.name); });

}  // namespace
