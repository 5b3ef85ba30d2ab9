#include "conformance.h"

using namespace harness;

namespace {

constexpr char kList[] = "/app_list/app_list.txt";

// Uploads as another device: CONFIG-PATH LOCAL REMOTE.
int upload_role(int argc, char **argv) {
  if (argc != 3) return 125;
  setenv("QUARN_CLOUD_CONFIG", argv[0], 1);
  int code = -1;
  backup_trans_init(
      &code, [](backup_trans_error_code error, void *out) { *static_cast<int *>(out) = error; });
  run_until([&] { return code >= 0; });
  backup_trans_handle_h handle = backup_trans_create_handle();
  code = -1;
  const int accepted = backup_trans_upload_file_ors_async(
      handle, argv[1], argv[2],
      [](backup_trans_error_code error, void *out, const backup_trans_file_info_s *) {
        *static_cast<int *>(out) = error;
      },
      1, 0, &code, nullptr);
  if (accepted != 0) return 124;
  run_until([&] { return code >= 0; });
  return code;
}
const bool added = add_role("upload", upload_role);

TEST_P(Conformance, UploadAfterAnUnchangedBasisReplacesIt) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  EXPECT_EQ(cloud.put(kList, "two"), 0);
  EXPECT_EQ(cloud.get(kList), "two");
}

TEST_P(Conformance, UploadOverAnObjectThatChangedSinceTheBasisConflicts) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  store->put(kList, "new");
  EXPECT_EQ(cloud.put(kList, "two"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(cloud.get(kList), "new");
}

TEST_P(Conformance, AbsenceIsABasisToo) {
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "<12>");
  store->put(kList, "first of another device");
  EXPECT_EQ(cloud.put(kList, "mine"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(cloud.get(kList), "first of another device");
}

TEST_P(Conformance, UploadAfterAnAbsenceThatLastsCreates) {
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "<12>");
  EXPECT_EQ(cloud.put(kList, "mine"), 0);
  EXPECT_EQ(store->content(), (std::map<std::string, std::string>{{kList, "mine"}}));
}

TEST_P(Conformance, ObjectThatVanishedSinceTheBasisConflicts) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  ASSERT_EQ(cloud.drop("/app_list"), 0);
  EXPECT_EQ(cloud.put(kList, "two"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_TRUE(store->content().empty());
}

TEST_P(Conformance, BasisIsSpentWithOneUpload) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  store->put(kList, "new");
  ASSERT_EQ(cloud.put(kList, "two"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(cloud.put(kList, "two"), 0);
  EXPECT_EQ(cloud.get(kList), "two");
}

TEST_P(Conformance, OtherTransfersChangeNoBasis) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  store->put(kList, "new");
  ASSERT_EQ(cloud.get(kList), "new");
  ASSERT_EQ(cloud.put("/other", "x"), 0);
  EXPECT_EQ(cloud.put(kList, "two"), BACKUP_TRANS_ERROR_CONFLICT);
}

TEST_P(Conformance, LaterBasisReplacesTheEarlierOne) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  store->put(kList, "new");
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "new");
  EXPECT_EQ(cloud.put(kList, "two"), 0);
  EXPECT_EQ(cloud.get(kList), "two");
}

TEST_P(Conformance, BasisIsTheHandlesOwn) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  backup_trans_handle_h first = cloud.handle;
  backup_trans_handle_h second = backup_trans_create_handle();
  ASSERT_NE(first, second);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  cloud.handle = second;
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  EXPECT_EQ(cloud.put(kList, "of the second"), 0);
  cloud.handle = first;
  EXPECT_EQ(cloud.put(kList, "of the first"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(cloud.get(kList), "of the second");
}

TEST_P(Conformance, UploadOfAnotherProcessConflicts) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  ASSERT_EQ(run_role({"upload", cloud.config_path(), cloud.file("of the other"), kList}), 0);
  EXPECT_EQ(cloud.put(kList, "mine"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(cloud.get(kList), "of the other");
}

}  // namespace
