// Every store's cases over S3 services that differ in what they have.
#include "s3_front_store.h"

namespace {

std::unique_ptr<TestStore> make_usual() { return std::make_unique<S3FrontStore>(); }

std::unique_ptr<TestStore> make_sparse() {
  S3Model::Settings settings;
  settings.conditions = S3Model::Conditions::refused;
  settings.deletes_many = false;
  settings.tags_are_md5 = false;
  settings.encodes_keys = false;
  settings.page = 7;
  return std::make_unique<S3FrontStore>(settings);
}

std::unique_ptr<TestStore> make_bare_tags() {
  S3Model::Settings settings;
  settings.conditions = S3Model::Conditions::bare_tags_only;
  return std::make_unique<S3FrontStore>(settings);
}

INSTANTIATE_TEST_SUITE_P(Store, Conformance,
                         ::testing::Values(StoreKind{"S3", make_usual},
                                           StoreKind{"SparseS3", make_sparse},
                                           StoreKind{"BareTagsS3", make_bare_tags}),
                         [](const auto &info) { return std::string(info.param.name); });

}  // namespace
