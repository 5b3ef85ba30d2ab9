// What the S3 store reads from and writes for its service.
#include <gtest/gtest.h>

#include "s3/backend_s3.h"
#include "s3/s3_xml.h"

using namespace transport;

namespace {

using Keys = std::vector<std::string>;

Keys keys_of(const S3Listing &listing) {
  Keys keys;
  for (const S3Object &object : listing.objects)
    keys.push_back(object.key + " " + std::to_string(object.size));
  return keys;
}

TEST(S3Listing, HoldsObjectsAndPrefixes) {
  S3Listing listing;
  ASSERT_TRUE(parse_s3_listing(
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      "<ListBucketResult xmlns=\"http://s3.amazonaws.com/doc/2006-03-01/\">"
      "<Name>b</Name><Prefix>a/</Prefix><KeyCount>3</KeyCount><MaxKeys>1000</MaxKeys>"
      "<Contents><Key>a/1</Key><LastModified>2026-11-21T19:44:52.000Z</LastModified>"
      "<ETag>&quot;5d41402abc4b2a76b9719d911017c592&quot;</ETag><Size>12345678901</Size>"
      "<StorageClass>STANDARD</StorageClass></Contents>"
      "<Contents><Size>0</Size><Key>a/2</Key></Contents>"
      "<CommonPrefixes><Prefix>a/b/</Prefix></CommonPrefixes>"
      "<CommonPrefixes><Prefix>a/c/</Prefix></CommonPrefixes>"
      "<IsTruncated>false</IsTruncated></ListBucketResult>",
      &listing));
  EXPECT_EQ(keys_of(listing), (Keys{"a/1 12345678901", "a/2 0"}));
  EXPECT_EQ(listing.prefixes, (Keys{"a/b/", "a/c/"}));
  EXPECT_FALSE(listing.truncated);
  EXPECT_EQ(listing.next, "");
}

TEST(S3Listing, OfMoreThanAnyPageHoldsIsNone) {
  std::string text = "<ListBucketResult><IsTruncated>false</IsTruncated>";
  for (int i = 0; i < 100000; ++i) text += "<a/>";
  S3Listing listing;
  EXPECT_FALSE(parse_s3_listing(text + "</ListBucketResult>", &listing));
}

TEST(S3Listing, APageOfTheLongestNamesWithAllThatServicesTellIsRead) {
  std::string text = "<ListBucketResult><EncodingType>url</EncodingType>";
  for (int i = 0; i < 1000; ++i) {
    text += "<Contents><Key>" + std::string(3000, 'k') +
            "</Key><LastModified>t</LastModified><ETag>&quot;e==&quot;</ETag><Size>1</Size>"
            "<ChecksumAlgorithm>c</ChecksumAlgorithm><ChecksumType>f</ChecksumType>"
            "<Owner><ID>i</ID><DisplayName>d</DisplayName></Owner>"
            "<RestoreStatus><IsRestoreInProgress>f</IsRestoreInProgress></RestoreStatus>"
            "<StorageClass>s</StorageClass></Contents>";
  }
  S3Listing listing;
  ASSERT_TRUE(parse_s3_listing(text + "</ListBucketResult>", &listing));
  EXPECT_EQ(listing.objects.size(), 1000U);
}

TEST(S3Listing, TellsWhereToGoOn) {
  S3Listing listing;
  ASSERT_TRUE(
      parse_s3_listing("<ListBucketResult><IsTruncated>true</IsTruncated><NextContinuationToken>"
                       "YSBi+/=</NextContinuationToken></ListBucketResult>",
                       &listing));
  EXPECT_TRUE(listing.truncated);
  EXPECT_EQ(listing.next, "YSBi+/=");
}

TEST(S3Listing, KeysAreDecodedWhereTheAnswerSaysThatTheyAreEncoded) {
  const std::string body =
      "<Contents><Key>a%20b+c%2Bd%2f%C3%A4%01%26</Key></Contents>"
      "<CommonPrefixes><Prefix>%25/</Prefix></CommonPrefixes></ListBucketResult>";
  S3Listing listing;
  ASSERT_TRUE(
      parse_s3_listing("<ListBucketResult><EncodingType>url</EncodingType>" + body, &listing));
  EXPECT_EQ(keys_of(listing), (Keys{"a b c+d/\xc3\xa4\x01& 0"}));
  EXPECT_EQ(listing.prefixes, (Keys{"%/"}));
  S3Listing plain;
  ASSERT_TRUE(parse_s3_listing("<ListBucketResult>" + body, &plain));
  EXPECT_EQ(keys_of(plain), (Keys{"a%20b+c%2Bd%2f%C3%A4%01%26 0"}));
  EXPECT_EQ(plain.prefixes, (Keys{"%25/"}));
}

TEST(S3Listing, BlanksOfAKeyAreKept) {
  S3Listing listing;
  ASSERT_TRUE(parse_s3_listing(
      "<ListBucketResult><Contents><Key> a </Key></Contents></ListBucketResult>", &listing));
  EXPECT_EQ(keys_of(listing), (Keys{" a  0"}));
}

TEST(S3Listing, KeysThatCannotBeDecodedAreLeftOut) {
  S3Listing listing;
  ASSERT_TRUE(
      parse_s3_listing("<ListBucketResult><EncodingType>url</EncodingType>"
                       "<Contents><Key>a%zz</Key></Contents><Contents><Key>a%00b</Key></Contents>"
                       "<Contents><Key>good</Key></Contents>"
                       "<CommonPrefixes><Prefix>%</Prefix></CommonPrefixes></ListBucketResult>",
                       &listing));
  EXPECT_EQ(keys_of(listing), (Keys{"good 0"}));
  EXPECT_TRUE(listing.prefixes.empty());
}

TEST(S3Listing, AnyPrefixOfTheNamespaceWillDo) {
  S3Listing listing;
  ASSERT_TRUE(
      parse_s3_listing("<s3:ListBucketResult xmlns:s3=\"urn:x\"><s3:Contents><s3:Key>k"
                       "</s3:Key></s3:Contents></s3:ListBucketResult>",
                       &listing));
  EXPECT_EQ(keys_of(listing), (Keys{"k 0"}));
}

TEST(S3Listing, WhatIsNoneIsRefused) {
  S3Listing listing;
  for (const char *text :
       {"", "garbage", "<ListBucketResult>", "<html/>", "<Error><Code>NoSuchBucket</Code></Error>",
        "<!DOCTYPE ListBucketResult [<!ENTITY a \"aaaa\">]><ListBucketResult/>",
        "<!-- x --><!DOCTYPE ListBucketResult SYSTEM \"http://127.0.0.1:9/x\"><ListBucketResult/>"})
    EXPECT_FALSE(parse_s3_listing(text, &listing)) << text;
  EXPECT_TRUE(listing.objects.empty());
}

TEST(S3Error, TellsItsCodeAndTheRegionThatWasExpected) {
  const S3Error error = parse_s3_error(
      "<?xml version='1.0'?><Error><Code>AuthorizationHeaderMalformed</Code>"
      "<Message>The region is wrong</Message><Region>eu-central-1</Region></Error>");
  EXPECT_EQ(error.code, "AuthorizationHeaderMalformed");
  EXPECT_EQ(error.region, "eu-central-1");
}

TEST(S3Error, HoldsNoTextThatIsNoPlainName) {
  const S3Error error =
      parse_s3_error("<Error><Code>secret: hunter2\n</Code><Region>eu:s3:x</Region></Error>");
  EXPECT_EQ(error.code, "");
  EXPECT_EQ(error.region, "");
  EXPECT_EQ(parse_s3_error("<Error><Code>" + std::string(65, 'a') + "</Code></Error>").code, "");
  for (const char *text : {"", "x", "<Code>A</Code>", "<Error/>"})
    EXPECT_EQ(parse_s3_error(text).code, "") << text;
}

TEST(S3Deletion, TellsWhatWasKept) {
  std::vector<S3Error> errors;
  ASSERT_TRUE(parse_s3_deletion(
      "<DeleteResult xmlns=\"http://s3.amazonaws.com/doc/2006-03-01/\"><Deleted><Key>a</Key>"
      "</Deleted><Error><Key>b</Key><Code>NoSuchKey</Code></Error><Error><Key>c</Key>"
      "<Code>AccessDenied</Code><Message>Access Denied</Message></Error><Error><Key>d</Key>"
      "</Error></DeleteResult>",
      &errors));
  ASSERT_EQ(errors.size(), 2U);
  EXPECT_EQ(errors[0].code, "AccessDenied");
  EXPECT_EQ(errors[1].code, "");
  errors.clear();
  EXPECT_TRUE(parse_s3_deletion("<DeleteResult/>", &errors));
  EXPECT_TRUE(errors.empty());
  for (const char *text : {"", "x", "<Error><Code>InternalError</Code></Error>"})
    EXPECT_FALSE(parse_s3_deletion(text, &errors)) << text;
}

TEST(S3Deletion, RequestHoldsEveryKeyAsItIs) {
  EXPECT_EQ(make_s3_deletion({"a/b c+%41\xc3\xa4", "<&>\"'\t\r\n"}),
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?><Delete><Quiet>true</Quiet>"
            "<Object><Key>a/b c+%41\xc3\xa4</Key></Object>"
            "<Object><Key>&#60;&#38;&#62;\"'&#9;&#13;&#10;</Key></Object></Delete>");
}

TEST(S3Deletion, KeysThatXmlCannotCarryAreKnown) {
  for (const char *key :
       {"", "plain", "\t\n\r", "\x7f", "\xc3\xa4", "\xef\xbf\xbd", "\xf0\x9f\x98\x80"})
    EXPECT_TRUE(fits_xml(key)) << key;
  for (const char *key : {"\x01", "a\x1f", "\x0b", "\xef\xbf\xbe", "\xef\xbf\xbf"})
    EXPECT_FALSE(fits_xml(key)) << key;
}

TEST(S3Query, IsSortedAndStrictlyEncoded) {
  EXPECT_EQ(make_s3_query({}), "");
  EXPECT_EQ(make_s3_query({{"delete", ""}}), "?delete=");
  EXPECT_EQ(make_s3_query({{"prefix", "a b/+%&=?#~!*'()\xc3\xa4"},
                           {"list-type", "2"},
                           {"delimiter", "/"},
                           {"max-keys", "1000"},
                           {"encoding-type", "url"}}),
            "?delimiter=%2F&encoding-type=url&list-type=2&max-keys=1000&prefix="
            "a%20b%2F%2B%25%26%3D%3F%23~%21%2A%27%28%29%C3%A4");
}

TEST(S3Path, IsStrictlyEncodedWithItsSlashes) {
  EXPECT_EQ(encode_path("a b/+%&=?#~!*'()\x01\xc3\xa4.-_Z9"),
            "a%20b/%2B%25%26%3D%3F%23~%21%2A%27%28%29%01%C3%A4.-_Z9");
}

TEST(S3Name, IsPlain) {
  EXPECT_TRUE(is_s3_name("eu-central-1"));
  EXPECT_TRUE(is_s3_name("My.bucket_1"));
  EXPECT_TRUE(is_s3_name(std::string(64, 'a')));
  for (const std::string &text : {std::string(), std::string(65, 'a'), std::string("a b"),
                                  std::string("a/b"), std::string("a:b"), std::string("a\n")})
    EXPECT_FALSE(is_s3_name(text)) << text;
}

std::string problem_with(const Config &config) {
  StoreUrl url;
  std::string problem;
  if (!parse_store_url(config.url, kS3Scheme, &url, &problem)) return problem;
  return make_s3_backend(url, config, &problem) == nullptr ? problem : "none";
}

Config config_with(const std::string &url) {
  Config config;
  config.url = url;
  config.user = "key";
  config.password = "secret";
  return config;
}

TEST(S3Config, UrlNamesABucketAndAFolderInIt) {
  for (const char *url :
       {"s3+https://host/bucket", "s3+https://host/bucket/", "s3+https://host/bucket/a/b%20c",
        "s3+http://127.0.0.1:1/bucket", "s3+https://[::1]:9000/b_1.x"})
    EXPECT_EQ(problem_with(config_with(url)), "none") << url;
  for (const char *url : {"s3+https://host", "s3+https://host/", "s3+https://host//a",
                          "s3+https://host/a%20b/c", "s3+https://host/.b/c"})
    EXPECT_EQ(problem_with(config_with(url)), "the url names no bucket") << url;
  EXPECT_EQ(problem_with(config_with("s3+https://host/b/a//c")),
            "the url's path behind the bucket is no folder");
  const std::string component(127, 'c');
  const std::string longest = "s3+https://host/b/" + component + "/" + component;
  EXPECT_EQ(problem_with(config_with(longest)), "none");
  EXPECT_EQ(problem_with(config_with(longest + "c")),
            "the url's path behind the bucket is too long");
  EXPECT_EQ(problem_with(config_with("s3+http://host/bucket")),
            "plain http is for this machine itself only");
}

TEST(S3Config, CredentialsRegionAndAddressingAreChecked) {
  Config config = config_with("s3+https://host/bucket");
  config.region = "eu-central-1";
  config.addressing = "virtual";
  EXPECT_EQ(problem_with(config), "none");
  config.addressing = "path";
  EXPECT_EQ(problem_with(config), "none");
  config.addressing = "dns";
  EXPECT_EQ(problem_with(config), "the addressing is neither path nor virtual");
  config = config_with("s3+https://127.0.0.1/bucket");
  config.addressing = "virtual";
  EXPECT_EQ(problem_with(config), "virtual addressing needs a host with a name");
  config = config_with("s3+https://host/bucket");
  config.region = "eu:s3";
  EXPECT_EQ(problem_with(config), "the region is no name");
  config = config_with("s3+https://host/bucket");
  config.user = "";
  EXPECT_EQ(problem_with(config), "the store needs an access key as user and a secret as password");
  config = config_with("s3+https://host/bucket");
  config.password = "";
  EXPECT_EQ(problem_with(config), "the store needs an access key as user and a secret as password");
}

}  // namespace
