#include "webdav/dav_client.h"

#include <gtest/gtest.h>

#include "webdav/backend_webdav.h"

using namespace transport;

namespace {

HttpAnswer answer(int status, std::map<std::string, std::string> headers = {}) {
  HttpAnswer made;
  made.status = status;
  made.headers = std::move(headers);
  return made;
}

TEST(DavNames, DotsInFrontAreHiddenFromServersThatHideThem) {
  const std::pair<const char *, const char *> cases[] = {
      {"", ""},         {"a", "a"},   {".a", "%2Ea"},     {"..a", "%2E.a"},
      {"a.b", "a.b"},   {"%", "%25"}, {"%2Ea", "%252Ea"}, {"%25", "%2525"},
      {"a%2E", "a%2E"}, {".", "%2E"}, {"%2ea", "%252ea"},
  };
  for (const auto &[name, stored] : cases) {
    EXPECT_EQ(stored_name(name), stored);
    EXPECT_EQ(name_of_stored(stored), name);
  }
  // What was not stored by this library keeps its name.
  for (const char *name : {".foreign", "%2", "%2ea", "%zz"}) EXPECT_EQ(name_of_stored(name), name);
}

TEST(DavNames, EveryComponentOfAPath) {
  EXPECT_EQ(stored_path(""), "");
  EXPECT_EQ(stored_path("/"), "/");
  EXPECT_EQ(stored_path("/.a/b/%c"), "/%2Ea/b/%25c");
  EXPECT_EQ(stored_path("/a/.b/"), "/a/%2Eb/");
}

TEST(DavAnswers, AbsenceIsWhatTheServerSays) {
  EXPECT_TRUE(is_absent(answer(404)));
  EXPECT_TRUE(is_absent(answer(410)));
  EXPECT_FALSE(is_absent(answer(403)));
  HttpAnswer lost = answer(404);
  lost.problem = failure(BACKUP_TRANS_ERROR_NETWORK, "lost");
  EXPECT_FALSE(is_absent(lost));
  EXPECT_FALSE(has_status(lost, 404));
}

TEST(DavAnswers, LengthsAgree) {
  EXPECT_TRUE(has_size(answer(200, {{"content-length", "12"}}), 12));
  EXPECT_FALSE(has_size(answer(200, {{"content-length", "12"}}), 13));
  EXPECT_FALSE(has_size(answer(200, {{"content-length", "garbage"}}), 13));
  EXPECT_TRUE(has_size(answer(200), 0));
  EXPECT_FALSE(has_size(answer(200), 1));
}

TEST(DavAnswers, LocksOfOthersAreWaitedFor) {
  const Outcome locked = dav_outcome(answer(423), "upload");
  EXPECT_EQ(locked.code, BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(locked.message, "upload: the server answered 423");
  EXPECT_TRUE(locked.transient);
  EXPECT_FALSE(dav_outcome(answer(405), "upload").transient);
}

TEST(DavClientTest, UrlsAndConditions) {
  StoreUrl url;
  std::string problem;
  ASSERT_TRUE(parse_store_url("webdav+https://h:1/d%20v/", kWebdavScheme, &url, &problem));
  Config config;
  config.user = "u";
  config.password = "p";
  config.ca_file = "/ca";
  const DavClient client(url, config);
  EXPECT_EQ(client.url_of("/a b/.c"), "https://h:1/d%20v/a%20b/%252Ec");
  EXPECT_EQ(client.lock_condition("/f", "<token>"), "If: <https://h:1/d%20v/f/> (<token>)");
  EXPECT_EQ(client.tag_condition("/f", "\"tag\""), "If: <https://h:1/d%20v/f> ([\"tag\"])");
  const HttpRequest request = client.request_for("PUT", "/x");
  EXPECT_EQ(request.method, "PUT");
  EXPECT_EQ(request.url, "https://h:1/d%20v/x");
  EXPECT_EQ(request.user, "u");
  EXPECT_EQ(request.password, "p");
  EXPECT_EQ(request.ca_file, "/ca");
}

TEST(DavClientTest, RedirectionToTheNameWithASlashMeansAFolder) {
  StoreUrl url;
  std::string problem;
  ASSERT_TRUE(parse_store_url("webdav+https://h/d", kWebdavScheme, &url, &problem));
  const DavClient client(url, {});
  EXPECT_TRUE(client.means_folder(answer(301, {{"location", "https://h/d/a/"}}), "/a"));
  EXPECT_TRUE(client.means_folder(answer(308, {{"location", "/d/a/"}}), "/a"));
  for (const char *location : {"https://h/d/a", "https://other/d/a/", "/d/b/", ""})
    EXPECT_FALSE(client.means_folder(answer(301, {{"location", location}}), "/a")) << location;
  EXPECT_FALSE(client.means_folder(answer(200, {{"location", "/d/a/"}}), "/a"));
}

}  // namespace
