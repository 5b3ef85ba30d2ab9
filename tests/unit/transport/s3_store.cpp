// Every store's cases, over S3 to a server in this process.
#include "s3_front_store.h"

namespace {

INSTANTIATE_TEST_SUITE_P(Store, Conformance,
                         ::testing::Values(StoreKind{"S3",
                                                     []() -> std::unique_ptr<TestStore> {
                                                       return std::make_unique<S3FrontStore>();
                                                     }}),
                         [](const auto &info) { return std::string(info.param.name); });

}  // namespace
