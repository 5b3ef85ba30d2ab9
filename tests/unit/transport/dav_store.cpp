// Every store's cases, over WebDAV to a server in this process.
#include "dav_front_store.h"

namespace {

INSTANTIATE_TEST_SUITE_P(Store, Conformance,
                         ::testing::Values(StoreKind{"Dav",
                                                     []() -> std::unique_ptr<TestStore> {
                                                       return std::make_unique<DavFrontStore>();
                                                     }}),
                         [](const auto &info) { return std::string(info.param.name); });

}  // namespace
