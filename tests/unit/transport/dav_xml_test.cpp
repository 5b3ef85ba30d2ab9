#include <glib.h>
#include <sys/resource.h>

#include "harness.h"
#include "webdav/dav_xml.h"

using namespace harness;
using transport::DavEntry;
using transport::parse_multistatus;

namespace {

constexpr char kHost[] = "cloud.example.org";

std::string text_of(const DavEntry &entry) {
  return entry.path + (entry.is_collection ? " folder " : " object ") + std::to_string(entry.size) +
         (entry.modified ? " at " + std::to_string(*entry.modified) : "");
}

std::vector<std::string> parsed(const std::string &xml, const std::string &host = kHost) {
  std::vector<DavEntry> entries;
  bool left_out = false;
  if (!parse_multistatus(xml, host, &entries, &left_out)) {
    EXPECT_TRUE(entries.empty());
    return {"refused"};
  }
  std::vector<std::string> texts;
  for (const DavEntry &entry : entries) texts.push_back(text_of(entry));
  return texts;
}

/** Bytes that this process has had at the most. */
std::size_t most_memory() {
  rusage usage{};
  getrusage(RUSAGE_SELF, &usage);
  return static_cast<std::size_t>(usage.ru_maxrss) << 10;
}

using Texts = std::vector<std::string>;

std::string document(const std::string &responses) {
  return R"(<?xml version="1.0" encoding="utf-8"?><D:multistatus xmlns:D="DAV:">)" + responses +
         "</D:multistatus>";
}

std::string object(const std::string &href, const std::string &properties = "<D:resourcetype/>",
                   const std::string &status = "HTTP/1.1 200 OK") {
  return document("<D:response><D:href>" + href + "</D:href><D:propstat><D:prop>" + properties +
                  "</D:prop><D:status>" + status + "</D:status></D:propstat></D:response>");
}

Texts href_alone(const std::string &href, const std::string &host = kHost) {
  return parsed(object(href), host);
}

TEST(DavXml, PrefixesDoNotMatter) {
  for (const std::string prefix : {"D:", "d:", "a:", "lp1:", ""}) {
    const std::string declaration =
        prefix.empty() ? "xmlns" : "xmlns:" + prefix.substr(0, prefix.size() - 1);
    const auto element = [&](const std::string &name, const std::string &content) {
      return "<" + prefix + name + ">" + content + "</" + prefix + name + ">";
    };
    const std::string xml =
        "<" + prefix + "multistatus " + declaration + "=\"DAV:\">" +
        element("response",
                element("href", "/dav/f/") +
                    element("propstat",
                            element("prop", element("resourcetype", element("collection", ""))) +
                                element("status", "HTTP/1.1 200 OK"))) +
        element("response",
                element("href", "/dav/f/o") +
                    element("propstat", element("prop", element("getcontentlength", "7") +
                                                            element("resourcetype", "")) +
                                            element("status", "HTTP/1.1 200 OK"))) +
        "</" + prefix + "multistatus>";
    EXPECT_EQ(parsed(xml), (Texts{"/dav/f folder 0", "/dav/f/o object 7"})) << prefix;
  }
}

TEST(DavXml, PrefixesMayChangeFromElementToElement) {
  EXPECT_EQ(parsed(R"(<multistatus xmlns="DAV:" xmlns:b="urn:uuid:1/">
    <x:response xmlns:x="DAV:"><y:href xmlns:y="DAV:">
      /dav/o
    </y:href><propstat><prop xmlns:lp1="DAV:" xmlns:lp2="http://apache.org/dav/props/">
      <lp2:executable>F</lp2:executable><lp1:getcontentlength b:dt="int"> 12 </lp1:getcontentlength>
      <lp1:resourcetype/></prop><status>HTTP/1.1 200 OK</status></propstat></x:response>
    </multistatus>)"),
            (Texts{"/dav/o object 12"}));
}

TEST(DavXml, ElementsOfOtherNamespacesAreNotTaken) {
  EXPECT_EQ(parsed(R"(<D:multistatus xmlns:D="DAV:" xmlns:o="other">
    <o:response><D:href>/dav/a</D:href></o:response>
    <D:response><o:href>/dav/b</o:href></D:response>
    <D:response><D:href>/dav/c</D:href><D:propstat><D:prop><o:getcontentlength>9</o:getcontentlength>
      <D:resourcetype><o:collection/></D:resourcetype></D:prop></D:propstat></D:response>
    </D:multistatus>)"),
            (Texts{"/dav/c object 0"}));
  EXPECT_EQ(parsed(R"(<multistatus xmlns="other"/>)"), (Texts{"refused"}));
  EXPECT_EQ(parsed("<multistatus/>"), (Texts{"refused"}));
  EXPECT_EQ(parsed(R"(<D:prop xmlns:D="DAV:"/>)"), (Texts{"refused"}));
}

TEST(DavXml, PropertiesComeInAnyOrderAndNumberOfGroups) {
  const std::string length = "<D:getcontentlength>5</D:getcontentlength>";
  const std::string time = "<D:getlastmodified>Sun, 06 Nov 1994 08:49:37 GMT</D:getlastmodified>";
  const std::string type = "<D:resourcetype/>";
  for (const std::string &properties :
       {length + time + type, type + time + length, time + type + length})
    EXPECT_EQ(parsed(object("/o", properties)), (Texts{"/o object 5 at 784111777"}));
  const auto group = [](const std::string &properties) {
    return "<D:propstat><D:status>HTTP/1.1 200 OK</D:status><D:prop>" + properties +
           "</D:prop></D:propstat>";
  };
  EXPECT_EQ(parsed(document("<D:response>" + group(time) + group(length) + group(type) +
                            "<D:href>/o</D:href></D:response>")),
            (Texts{"/o object 5 at 784111777"}));
}

TEST(DavXml, PropertiesThatTheServerDoesNotHaveCountNothing) {
  EXPECT_EQ(parsed(document(
                "<D:response><D:href>/o</D:href>"
                "<D:propstat><D:prop><D:resourcetype/></D:prop><D:status>HTTP/1.1 200 OK</D:status>"
                "</D:propstat><D:propstat><D:prop><D:getcontentlength>4</D:getcontentlength>"
                "<D:resourcetype><D:collection/></D:resourcetype></D:prop>"
                "<D:status>HTTP/1.1 404 Not Found</D:status></D:propstat></D:response>")),
            (Texts{"/o object 0"}));
  EXPECT_EQ(parsed(object("/o", "<D:getcontentlength>4</D:getcontentlength>", "HTTP/1.1 404 2")),
            (Texts{"/o object 0"}));
  EXPECT_EQ(parsed(object("/o", "<D:getcontentlength>4</D:getcontentlength>", "nonsense")),
            (Texts{"/o object 0"}));
  EXPECT_EQ(parsed(document("<D:response><D:href>/o</D:href><D:propstat/></D:response>")),
            (Texts{"/o object 0"}));
  EXPECT_EQ(parsed(document("<D:response><D:href>/o</D:href></D:response>")),
            (Texts{"/o object 0"}));
}

TEST(DavXml, ResourcesWithAnErrorOfTheirOwnAreLeftOut) {
  EXPECT_EQ(parsed(document("<D:response><D:href>/gone</D:href>"
                            "<D:status>HTTP/1.1 404 Not Found</D:status></D:response>"
                            "<D:response><D:href>/there</D:href>"
                            "<D:status>HTTP/1.1 200 OK</D:status></D:response>")),
            (Texts{"/there object 0"}));
}

TEST(DavXml, ThatSomethingIsLeftOutIsTold) {
  const std::string forbidden =
      "<D:response><D:href>/f/a</D:href><D:status>HTTP/1.1 403 Forbidden</D:status></D:response>";
  for (const std::string &xml :
       {document(forbidden), object("/f/%00"), object("/f/%zz"), object("//f"), object("f/a"),
        object("http://other.example.org/f/a"), document("<D:response/>")}) {
    std::vector<DavEntry> entries;
    bool left_out = false;
    EXPECT_TRUE(parse_multistatus(xml, kHost, &entries, &left_out));
    EXPECT_EQ(left_out, entries.empty()) << xml;
  }
}

TEST(DavXml, CollectionsHaveNoLength) {
  EXPECT_EQ(parsed(object("/f",
                          "<D:getcontentlength>4096</D:getcontentlength>"
                          "<D:resourcetype><D:collection/></D:resourcetype>")),
            (Texts{"/f folder 0"}));
}

TEST(DavXml, TypeThatIsNotToldIsSeenAtTheSlash) {
  EXPECT_EQ(parsed(object("/f/", "<D:getcontentlength>9</D:getcontentlength>")),
            (Texts{"/f folder 0"}));
  EXPECT_EQ(parsed(object("/f", "<D:getcontentlength>9</D:getcontentlength>")),
            (Texts{"/f object 9"}));
  EXPECT_EQ(parsed(object("/f/", "<D:resourcetype/>")), (Texts{"/f object 0"}));
}

TEST(DavXml, LengthsThatAreNoneCountNothing) {
  for (const char *length : {"", "-1", "0x10", "12 bytes", "1e3", "18446744073709551616"})
    EXPECT_EQ(parsed(object("/o", std::string("<D:resourcetype/><D:getcontentlength>") + length +
                                      "</D:getcontentlength>")),
              (Texts{"/o object 0"}))
        << length;
  EXPECT_EQ(parsed(object("/o", "<D:getcontentlength>18446744073709551615</D:getcontentlength>")),
            (Texts{"/o object 18446744073709551615"}));
}

TEST(DavXml, TimesThatAreNoneCountNothing) {
  EXPECT_EQ(parsed(object("/o", "<D:getlastmodified>yesterday</D:getlastmodified>")),
            (Texts{"/o object 0"}));
}

TEST(DavXml, PercentEscapesInEitherCase) {
  EXPECT_EQ(href_alone("/d%c3%a4v/%2Fx%2fy%20z%7E~"), (Texts{"/d\xc3\xa4v//x/y z~~ object 0"}));
  EXPECT_EQ(href_alone("/D%C3%A4v"), (Texts{"/D\xc3\xa4v object 0"}));
  EXPECT_EQ(href_alone("/a%2541"), (Texts{"/a%41 object 0"}));
  EXPECT_EQ(href_alone("/a&amp;b&#x41;+c"), (Texts{"/a&bA+c object 0"}));
  for (const char *bad : {"/a%", "/a%4", "/a%zz", "/a%00b"})
    EXPECT_EQ(href_alone(bad), Texts{}) << bad;
}

TEST(DavXml, SlashesAtTheEndGo) {
  EXPECT_EQ(href_alone("/a/b/"), (Texts{"/a/b object 0"}));
  EXPECT_EQ(href_alone("/a/b//"), (Texts{"/a/b object 0"}));
  EXPECT_EQ(href_alone("/"), (Texts{"/ object 0"}));
  EXPECT_EQ(href_alone("https://cloud.example.org/"), (Texts{"/ object 0"}));
}

TEST(DavXml, AbsoluteReferencesOfThisServer) {
  for (const char *href : {"https://cloud.example.org/a", "https://cloud.example.org:443/a",
                           "HTTPS://Cloud.Example.ORG/a", "http://cloud.example.org/a",
                           "http://cloud.example.org:8080/a"})
    EXPECT_EQ(href_alone(href), (Texts{"/a object 0"})) << href;
  EXPECT_EQ(href_alone("http://[::1]:8080/a", "::1"), (Texts{"/a object 0"}));
  EXPECT_EQ(href_alone("http://[::1]/a", "::1"), (Texts{"/a object 0"}));
  for (const char *href : {"https://cloud.example.org", "https://cloud.example.org.evil/a",
                           "https://other/a", "a", "", "./a", "https:///a", "http://[::1/a",
                           "cloud.example.org/a", "https://u@cloud.example.org/a"})
    EXPECT_EQ(href_alone(href), Texts{}) << href;
}

TEST(DavXml, ReferencesAreTextHoweverTheyAreWritten) {
  EXPECT_EQ(href_alone("<![CDATA[/a b]]>"), (Texts{"/a b object 0"}));
  EXPECT_EQ(href_alone("/a<!-- comment -->b"), (Texts{"/ab object 0"}));
}

TEST(DavXml, DocumentTypesAreRefused) {
  const std::string rest = object("/o").substr(object("").find("?>") + 2);
  const std::string head = R"(<?xml version="1.0"?>)";
  EXPECT_EQ(parsed(head + rest), (Texts{"/o object 0"}));
  EXPECT_EQ(parsed(head + "<!DOCTYPE multistatus>" + rest), (Texts{"refused"}));
  EXPECT_EQ(parsed(head + R"(<!DOCTYPE m SYSTEM "http://127.0.0.1:9/x.dtd">)" + rest),
            (Texts{"refused"}));
  std::string bomb = head + R"(<!DOCTYPE m [<!ENTITY a0 "aaaaaaaaaa">)";
  for (int i = 1; i < 12; ++i) {
    bomb += "<!ENTITY a" + std::to_string(i) + " \"";
    for (int k = 0; k < 10; ++k) bomb += "&a" + std::to_string(i - 1) + ";";
    bomb += "\">";
  }
  EXPECT_EQ(parsed(bomb + "]>" +
                   document("<D:response><D:href>/&a11;</D:href></D:response>")
                       .substr(document("").find("?>") + 2)),
            (Texts{"refused"}));
}

// What one does not see when one looks for it byte by byte.
TEST(DavXml, DocumentTypesInOtherEncodingsAreRefused) {
  const auto utf16 = [](const std::string &text) {
    std::string wide = "\xff\xfe";
    for (const char c : text) wide += std::string{c, '\0'};
    return wide;
  };
  const std::string rest = object("/o").substr(object("").find("?>") + 2);
  EXPECT_EQ(parsed(utf16(rest)), (Texts{"/o object 0"}));
  EXPECT_EQ(parsed(utf16(R"(<!DOCTYPE m [<!ENTITY a "/etc/passwd">]>)" + rest)),
            (Texts{"refused"}));
}

TEST(DavXml, EntitiesThatNobodyDeclaredAreRefused) {
  EXPECT_EQ(href_alone("/&nobody;"), (Texts{"refused"}));
}

TEST(DavXml, GarbageIsRefused) {
  const std::string good = object("/o");
  for (const std::string &text :
       {std::string(), std::string("\0\0\0", 3), std::string("not xml"), bytes(10000),
        std::string("<html><body>Welcome</body></html>"), good + "<more/>", "x" + good,
        object("/o\xff"), object(std::string("/o\0x", 4))})
    EXPECT_EQ(parsed(text), (Texts{"refused"}));
}

TEST(DavXml, TruncatedDocumentsAreRefused) {
  const std::string good = object("/o");
  for (std::size_t length = 0; length < good.size(); ++length)
    EXPECT_EQ(parsed(good.substr(0, length)), (Texts{"refused"})) << length;
}

TEST(DavXml, NestingWithoutEndIsRefused) {
  std::string deep;
  for (int i = 0; i < 100000; ++i) deep += "<D:response>";
  EXPECT_EQ(parsed(R"(<D:multistatus xmlns:D="DAV:">)" + deep), (Texts{"refused"}));
}

TEST(DavXml, LargeListingsAreRead) {
  constexpr int kEntries = 20000;
  std::string responses;
  for (int i = 0; i < kEntries; ++i) {
    const std::string one = object("/dav/folder/" + std::to_string(i),
                                   "<D:resourcetype/><D:getcontentlength>1</D:getcontentlength>");
    const std::size_t start = one.find("<D:response>");
    responses += one.substr(start, one.rfind("</D:multistatus>") - start);
  }
  const Texts texts = parsed(document(responses));
  ASSERT_EQ(texts.size(), static_cast<std::size_t>(kEntries));
  EXPECT_EQ(texts.back(), "/dav/folder/19999 object 1");
}

TEST(DavXml, NameMayBeAsLongAsTheXmlLibraryTakesATextToBe) {
  constexpr std::size_t kBytes = 9U << 20;
  std::vector<DavEntry> entries;
  bool left_out = true;
  ASSERT_TRUE(
      parse_multistatus(object("/" + std::string(kBytes, 'x')), kHost, &entries, &left_out));
  EXPECT_FALSE(left_out);
  ASSERT_EQ(entries.size(), 1U);
  EXPECT_EQ(entries[0].path.size(), kBytes + 1);
  EXPECT_EQ(href_alone("/" + std::string(15U << 20, 'x')), Texts{"refused"});
}

TEST(DavXml, WhatWasReadBeforeAnErrorIsNotKept) {
  const std::string whole = object("/dav/folder/a");
  const std::string responses = whole.substr(0, whole.rfind("</D:multistatus>"));
  EXPECT_EQ(parsed(responses + "<D:response></D:multistatus>"), Texts{"refused"});
  EXPECT_EQ(parsed(whole + "<more/>"), Texts{"refused"});
  EXPECT_EQ(parsed(responses + "words<!-- and --><?what else?></D:multistatus>"),
            Texts{"/dav/folder/a object 0"});
}

TEST(DavXml, EmptyListing) { EXPECT_EQ(parsed(document("")), Texts{}); }

TEST(LockToken, IsFoundByItsOwner) {
  const std::string xml =
      "<?xml version=\"1.0\"?><x:multistatus xmlns:x=\"DAV:\"><x:response><x:href>/f/</x:href>"
      "<x:propstat><x:prop><x:lockdiscovery>"
      "<x:activelock><x:owner>somebody</x:owner><x:locktoken><x:href>urn:1</x:href></x:locktoken>"
      "</x:activelock>"
      "<x:activelock><x:owner> me\n</x:owner><x:locktoken><x:href>urn:2</x:href></x:locktoken>"
      "</x:activelock></x:lockdiscovery></x:prop></x:propstat></x:response></x:multistatus>";
  EXPECT_EQ(transport::parse_lock_token(xml, "me"), "<urn:2>");
  EXPECT_EQ(transport::parse_lock_token(xml, "you"), "");
  EXPECT_EQ(transport::parse_lock_token("<garbage", "me"), "");
}

using transport::DavLock;
using transport::parse_lock;

std::string lock_document(const std::string &content) {
  return document("<D:response><D:href>/f/</D:href><D:propstat><D:prop><D:lockdiscovery>" +
                  content + "</D:lockdiscovery></D:prop></D:propstat></D:response>");
}

TEST(DavXml, LocksAreFound) {
  DavLock lock;
  ASSERT_TRUE(parse_lock(
      lock_document(
          "<D:activelock><D:owner> "
          "quarnd\n</D:owner><D:timeout>Second-30</D:timeout><D:locktoken><D:href>urn:uuid:1"
          "</D:href></D:locktoken><D:lockroot><D:href>/f%20x/</D:href></D:lockroot>"
          "</D:activelock><D:activelock><D:owner>other</D:owner></D:activelock>"),
      kHost, &lock));
  EXPECT_EQ(lock.owner, "quarnd");
  EXPECT_EQ(lock.token, "<urn:uuid:1>");
  EXPECT_EQ(lock.root, "/f x");
  EXPECT_EQ(lock.seconds, 30U);
}

TEST(DavXml, LocksMayTellLittle) {
  DavLock lock;
  ASSERT_TRUE(parse_lock(
      lock_document("<D:activelock><D:locktoken><D:href>t</D:href></D:locktoken></D:activelock>"),
      kHost, &lock));
  EXPECT_EQ(lock.owner, "");
  EXPECT_EQ(lock.token, "<t>");
  EXPECT_EQ(lock.root, "");
  EXPECT_EQ(lock.seconds, 0U);
}

TEST(DavXml, WhatIsNoLock) {
  DavLock lock;
  for (const std::string &xml :
       {lock_document(""), lock_document("<D:activelock/>"),
        lock_document("<D:activelock><D:locktoken/></D:activelock>"), std::string("garbage"),
        std::string(R"(<D:activelock xmlns:D="DAV:"/>)"), std::string("<!DOCTYPE m>") + "<m/>"})
    EXPECT_FALSE(parse_lock(xml, kHost, &lock)) << xml;
}

// It is sent back in a header.
TEST(DavXml, ATokenThatWouldEndAHeaderIsNone) {
  for (const char *token : {"t&#13;&#10;X-Other: 1", "t&#10;x", "a b", "a&gt; &lt;b", "\xc3\xa4"}) {
    const std::string xml =
        lock_document("<D:activelock><D:owner>me</D:owner><D:locktoken><D:href>" +
                      std::string(token) + "</D:href></D:locktoken></D:activelock>");
    DavLock lock;
    EXPECT_FALSE(parse_lock(xml, kHost, &lock)) << token;
    EXPECT_EQ(transport::parse_lock_token(xml, "me"), "") << token;
  }
}

std::string many(const std::string &element, std::size_t count) {
  std::string text;
  for (std::size_t i = 0; i < count; ++i) text += element;
  return text;
}

// Each node is a hundred times its bytes.
TEST(DavXml, OneResponseOfAMillionElementsIsRefusedAndTakesNoMemory) {
  const std::size_t before = most_memory();
  for (const std::string &content : {many("<a/>", 4000000), many("<a b='' c=''/>", 1000000),
                                     many("<a>x", 200) + many("<b/>", 4000000)}) {
    EXPECT_EQ(parsed(document("<D:response>" + content + "</D:response>")), Texts{"refused"});
    const std::string lock = document("<D:activelock>" + content + "</D:activelock>");
    transport::DavLock found;
    EXPECT_FALSE(transport::parse_lock(lock, kHost, &found));
    EXPECT_EQ(transport::parse_lock_token(lock, "owner"), "");
  }
  EXPECT_LT(most_memory() - before, std::size_t{96} << 20);
}

TEST(DavXml, AListingOfAsManyResponsesAsThereMayBeIsReadAndALongerOneIsNone) {
  const std::string response = "<D:response><D:href>/f/o</D:href></D:response>";
  EXPECT_EQ(parsed(document(many(response, 50000))).size(), 50000U);
  EXPECT_EQ(parsed(document(many(response, 50001))), Texts{"refused"});
}

}  // namespace
