#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>

#include "conformance.h"

using namespace harness;

namespace {

using Content = std::map<std::string, std::string>;

TEST_P(Conformance, UploadedBytesComeBack) {
  for (const std::size_t size : {0U, 1U, 100U * 1024U, 256U * 1024U, 30U * 1024U * 1024U}) {
    const std::string content = bytes(size);
    const AnswerPtr answer = cloud.upload(cloud.file(content), "/dir/object");
    ASSERT_TRUE(cloud.settle());
    ASSERT_EQ(answer->code, 0);
    ASSERT_TRUE(answer->has_info);
    EXPECT_EQ(answer->children[0], (Child{"/dir/object", true, size, 0}));
    EXPECT_TRUE(cloud.get("/dir/object") == content) << size;
    EXPECT_EQ(cloud.children("/dir"), (std::vector<Child>{{"/dir/object", true, size, 0}}));
  }
}

TEST_P(Conformance, StoreHoldsExactlyWhatWasUploaded) {
  Content expected;
  for (int i = 0; i < 40; ++i) {
    const std::string path = "/d" + std::to_string(i % 3) + "/sub/" + std::to_string(i);
    expected[path] = bytes(1000 + static_cast<std::size_t>(i), static_cast<unsigned>(i));
    ASSERT_EQ(cloud.upload(cloud.file(expected[path]), path)->accepted, 0);
  }
  ASSERT_TRUE(cloud.settle());
  for (const AnswerPtr &answer : cloud.answers()) EXPECT_EQ(answer->code, 0);
  EXPECT_EQ(store->content(), expected);
}

TEST_P(Conformance, UploadReplacesTheObject) {
  ASSERT_EQ(cloud.put("/a", "a longer first content"), 0);
  ASSERT_EQ(cloud.put("/a", "second"), 0);
  EXPECT_EQ(store->content(), (Content{{"/a", "second"}}));
}

TEST_P(Conformance, TimeGivenAtTheUploadIsTold) {
  const int64_t when = 1234567890123;
  const AnswerPtr up = cloud.upload(cloud.file("x"), "/t/a", when, "application/zip");
  ASSERT_TRUE(cloud.settle());
  ASSERT_TRUE(up->has_info);
  EXPECT_EQ(up->children[0].timestamp_ms, when);
  const std::vector<Child> children = cloud.children("/t");
  ASSERT_EQ(children.size(), 1U);
  EXPECT_EQ(children[0].timestamp_ms, store->lists_timestamps() ? when : 0);
}

TEST_P(Conformance, AbsentObjectIsReportedAndNothingIsMade) {
  ASSERT_EQ(cloud.put("/folder/x", "x"), 0);
  for (const char *path : {"/absent", "/absent/deep", "/folder", "/folder/x/y"}) {
    const std::string place = cloud.file("before");
    const AnswerPtr answer = cloud.download(path, place);
    ASSERT_TRUE(cloud.settle());
    EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) << path;
    EXPECT_FALSE(answer->message.empty());
    EXPECT_EQ(read_file(place), "before");
  }
}

TEST_P(Conformance, DownloadReplacesTheLocalFileAndIsPrivate) {
  ASSERT_EQ(cloud.put("/a", "from the store"), 0);
  const TempDir local;
  write_file(local / "file", "a longer content from before", 0644);
  write_file(local / "victim", "victim");
  ASSERT_EQ(symlink("victim", (local / "link").c_str()), 0);
  for (const char *name : {"file", "link", "fresh"}) {
    const AnswerPtr answer = cloud.download("/a", local / name);
    ASSERT_TRUE(cloud.settle());
    ASSERT_EQ(answer->code, 0);
    EXPECT_FALSE(answer->has_info);
    struct stat status {};
    ASSERT_EQ(lstat((local / name).c_str(), &status), 0);
    EXPECT_EQ(status.st_mode, S_IFREG | 0600U) << name;
    EXPECT_EQ(read_file(local / name), "from the store");
  }
  EXPECT_EQ(tree(local.path()), (Content{{"/file", "from the store"},
                                         {"/link", "from the store"},
                                         {"/fresh", "from the store"},
                                         {"/victim", "victim"}}));
}

TEST_P(Conformance, DownloadOverAFolderFailsAndLeavesNothing) {
  ASSERT_EQ(cloud.put("/a", "x"), 0);
  const TempDir local;
  ASSERT_EQ(mkdir((local / "folder").c_str(), 0700), 0);
  const AnswerPtr answer = cloud.download("/a", local / "folder");
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_LOCAL_FILE);
  EXPECT_EQ(tree(local.path()), (Content{{"/folder/", ""}}));
}

TEST_P(Conformance, LocalFileIsWhatItWasWhenTheUploadWasAccepted) {
  store->hold();
  const std::string replaced = cloud.file("replaced before");
  const std::string deleted = cloud.file("deleted before");
  const AnswerPtr first = cloud.upload(replaced, "/replaced");
  const AnswerPtr second = cloud.upload(deleted, "/deleted");
  write_file(replaced + ".new", "replaced after");
  ASSERT_EQ(rename((replaced + ".new").c_str(), replaced.c_str()), 0);
  ASSERT_EQ(unlink(deleted.c_str()), 0);
  store->release();
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(first->code, 0);
  EXPECT_EQ(second->code, 0);
  EXPECT_EQ(store->content(),
            (Content{{"/replaced", "replaced before"}, {"/deleted", "deleted before"}}));
}

TEST_P(Conformance, LocalFileThatShrinksUnderTheUploadStoresNothing) {
  ASSERT_EQ(cloud.put("/a", "old"), 0);
  store->hold();
  const std::string local = cloud.file(bytes(500000));
  const AnswerPtr answer = cloud.upload(local, "/a");
  const AnswerPtr fresh = cloud.upload(local, "/fresh/b");
  ASSERT_EQ(truncate(local.c_str(), 1000), 0);
  store->release();
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_LOCAL_FILE);
  EXPECT_FALSE(answer->has_info);
  EXPECT_EQ(fresh->code, BACKUP_TRANS_ERROR_LOCAL_FILE);
  EXPECT_EQ(store->content(), (Content{{"/a", "old"}}));
}

TEST_P(Conformance, FullStoreIsToldAndKeepsTheOldObject) {
  const std::string old_content = bytes(1000);
  ASSERT_EQ(cloud.put("/a", old_content), 0);
  const std::string big = cloud.file(bytes(3 << 20));
  store->fill(500000);
  const AnswerPtr over = cloud.upload(big, "/a");
  const AnswerPtr fresh = cloud.upload(big, "/fresh/b");
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(over->code, BACKUP_TRANS_ERROR_QUOTA);
  EXPECT_EQ(fresh->code, BACKUP_TRANS_ERROR_QUOTA);
  store->unfill();
  EXPECT_TRUE(store->content() == (Content{{"/a", old_content}}));
  EXPECT_EQ(cloud.put("/a", bytes(3 << 20)), 0);
}

TEST_P(Conformance, RefusedCredentialsAreTold) {
  ASSERT_EQ(cloud.put("/a", "x"), 0);
  store->lock_out();
  EXPECT_EQ(cloud.get("/a"), "<10>");
  EXPECT_EQ(cloud.put("/a", "y"), BACKUP_TRANS_ERROR_AUTHENTICATION);
  EXPECT_EQ(cloud.drop("/a"), BACKUP_TRANS_ERROR_AUTHENTICATION);
  const AnswerPtr list = cloud.list("/");
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(list->code, BACKUP_TRANS_ERROR_AUTHENTICATION);
  EXPECT_FALSE(list->has_info);
  store->let_in();
  EXPECT_EQ(cloud.get("/a"), "x");
}

TEST_P(Conformance, CallbacksComeOnceOnTheMainContextAndNotFromInsideTheCall) {
  const auto main_thread = std::this_thread::get_id();
  std::vector<AnswerPtr> answers = {cloud.upload(cloud.file("x"), "/a"),
                                    cloud.download("/b", cloud.place()), cloud.list("/"),
                                    cloud.remove("/c")};
  for (const AnswerPtr &answer : answers) {
    EXPECT_EQ(answer->accepted, 0);
    EXPECT_EQ(answer->calls, 0);
  }
  // Nothing is delivered unless the context runs.
  ASSERT_EQ(backup_trans_download_file_ors(cloud.handle, "/none", cloud.place().c_str(), 0), 12);
  for (const AnswerPtr &answer : answers) EXPECT_EQ(answer->calls, 0);
  ASSERT_TRUE(cloud.settle());
  for (const AnswerPtr &answer : answers) {
    EXPECT_EQ(answer->calls, 1);
    EXPECT_EQ(answer->thread, main_thread);
  }
}

TEST_P(Conformance, SynchronousDownloadNeedsNoMainContext) {
  ASSERT_EQ(cloud.put("/a", "x"), 0);
  const std::string place = cloud.place();
  EXPECT_EQ(backup_trans_download_file_ors(cloud.handle, "/a", place.c_str(), 0), 0);
  EXPECT_EQ(read_file(place), "x");
  EXPECT_EQ(backup_trans_download_file_ors(cloud.handle, "/b", place.c_str(), 0),
            BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
  EXPECT_EQ(read_file(place), "x");
}

TEST_P(Conformance, CallsComeFromManyThreads) {
  struct Job {
    std::atomic<int> code{-1};
    std::atomic<int> calls{0};
    std::atomic<bool> on_main{true};
    std::thread::id main_thread;
  };
  constexpr int kThreads = 6;
  constexpr int kEach = 8;
  std::vector<Job> jobs(kThreads * kEach);
  for (Job &job : jobs) job.main_thread = std::this_thread::get_id();
  std::vector<std::string> files;
  for (int i = 0; i < kThreads * kEach; ++i)
    files.push_back(cloud.file(bytes(5000, static_cast<unsigned>(i))));
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = t * kEach; i < (t + 1) * kEach; ++i) {
        const std::string remote = "/threads/" + std::to_string(i);
        EXPECT_EQ(backup_trans_upload_file_ors_async(
                      cloud.handle, files[static_cast<std::size_t>(i)].c_str(), remote.c_str(),
                      [](backup_trans_error_code error, void *user_data,
                         const backup_trans_file_info_s *) {
                        Job &job = *static_cast<Job *>(user_data);
                        job.code = error;
                        if (std::this_thread::get_id() != job.main_thread) job.on_main = false;
                        ++job.calls;
                      },
                      1, 0, &jobs[static_cast<std::size_t>(i)], nullptr),
                  0);
      }
    });
  }
  ASSERT_TRUE(run_until([&] {
    return std::all_of(jobs.begin(), jobs.end(), [](const Job &job) { return job.calls > 0; });
  }));
  for (std::thread &thread : threads) thread.join();
  for (const Job &job : jobs) {
    EXPECT_EQ(job.code, 0);
    EXPECT_EQ(job.calls, 1);
    EXPECT_TRUE(job.on_main);
  }
  EXPECT_EQ(store->content().size(), jobs.size());
}

TEST_P(Conformance, CallbackMayMakeRequestsAndRunTheMainContext) {
  struct Chain {
    Cloud *cloud;
    int code = -1;
    int nested = -1;
  } chain{&cloud};
  ASSERT_EQ(cloud.put("/a/x", "x"), 0);
  const int accepted = backup_trans_get_folder_child_list_async(
      cloud.handle, "/", 0, 100, 0, &chain,
      [](backup_trans_error_code error, void *user_data, const backup_trans_child_list_s *) {
        Chain &chain = *static_cast<Chain *>(user_data);
        chain.nested = chain.cloud->drop("/a");
        chain.code = error;
      });
  ASSERT_EQ(accepted, 0);
  ASSERT_TRUE(run_until([&] { return chain.code >= 0; }));
  EXPECT_EQ(chain.code, 0);
  EXPECT_EQ(chain.nested, 0);
  EXPECT_TRUE(store->content().empty());
}

}  // namespace
