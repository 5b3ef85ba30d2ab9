// What a WebDAV server says of folders, and when it does not say it.
#include <glib.h>

#include "core/ticket.h"
#include "dav_test.h"
#include "http/http.h"

using namespace harness;
using front::Response;
using front::Rule;

namespace {

// The question whether there is a folder is answered with an error once.
class UnknownFolder : public DavTest {
 protected:
  static Rule unknown(const char *folder) { return refusal("PROPFIND", folder, 503); }
};

TEST_F(UnknownFolder, IsNoReasonToMissAnObject) {
  model.put(kObject, "content");
  server.set_rules({unknown("/f/")});
  EXPECT_EQ(cloud.get(kObject), "content");
  EXPECT_EQ(clock.pauses().size(), 1U);
}

TEST_F(UnknownFolder, ThatStaysSoIsTheServersFailure) {
  model.put(kObject, "content");
  server.set_rules({refusal("PROPFIND", "/f/", 503, front::kForEver)});
  const AnswerPtr answer = cloud.download(kObject, cloud.place());
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_SERVER);
}

TEST_F(UnknownFolder, IsAskedForAgainWhereAnObjectWasAskedFor) {
  model.put("/f/o/inside", "x");
  server.set_rules({unknown(kObject), refusal("GET", kObject, 405, front::kForEver)});
  EXPECT_EQ(cloud.get(kObject), "<12>");
  EXPECT_EQ(clock.pauses().size(), 1U);
}

TEST_F(UnknownFolder, IsNotReplacedByAMove) {
  model.put("/f/o/inside", "x");
  server.set_rules({unknown(kObject), {"MOVE", "/f/", "overwrite", "T"}});
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(server.count(1), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(model.content(), (Content{{"/f/o/inside", "x"}}));
}

TEST_F(UnknownFolder, IsAskedForAgainBeforeTheObjectIsReplaced) {
  model.put(kObject, "old");
  server.set_rules({unknown(kObject)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(model.content(), (Content{{kObject, "new"}}));
}

TEST_F(UnknownFolder, IsAskedForAgainAfterTheMove) {
  model.put("/f/p", "x");
  server.set_rules({unknown(kObject), refusal("HEAD", kObject, 404)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(model.content(), (Content{{kObject, "new"}, {"/f/p", "x"}}));
}

TEST_F(UnknownFolder, IsAskedForAgainAfterARefusedPut) {
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  server.set_rules({unknown("/f/"), refusal("PUT", "/f/", 500)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(requests("PUT", "/f/"), 3);
}

TEST_F(UnknownFolder, IsAskedForAgainBeforeAnUploadInPlace) {
  model.refuse("MOVE", 501);
  model.put("/f/x", "x");
  server.set_rules({unknown(kObject)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(requests("MOVE", ""), 2);
  server.set_rules({unknown(kObject)});
  EXPECT_EQ(cloud.put(kObject, "newer"), 0);
  EXPECT_EQ(clock.pauses().size(), 2U);
  EXPECT_EQ(model.content(), (Content{{kObject, "newer"}, {"/f/x", "x"}}));
}

TEST_F(UnknownFolder, IsAskedForAgainWhenTheMoveFindsNone) {
  model.put("/f/o/inside", "x");
  server.set_rules({unknown(kObject), refusal("MOVE", "/f/", 409)});
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(model.content(), (Content{{"/f/o/inside", "x"}}));
}

TEST_F(UnknownFolder, IsNoneWhereTheQuestionIsTooOdd) {
  model.put(kObject, "old");
  server.set_rules({refusal("PROPFIND", kObject, 400, front::kForEver)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(model.content(), (Content{{kObject, "new"}}));
}

TEST_F(UnknownFolder, IsNotAnsweredByWhoAsksForAPassword) {
  model.put(kObject, "content");
  server.set_rules({refusal("PROPFIND", "/f/", 401)});
  const AnswerPtr answer = cloud.download(kObject, cloud.place());
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_AUTHENTICATION);
}

TEST_F(UnknownFolder, IsNotAnsweredByAnythingElse) {
  model.put(kObject, "content");
  Rule garbage = refusal("PROPFIND", "/f/", 207);
  server.set_rules({garbage});
  const AnswerPtr answer = cloud.download(kObject, cloud.place());
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_SERVER);
}

// A folder that another device prunes once the object was sent to it, before it can be locked.
class PrunedFolder : public DavTest, public ::testing::WithParamInterface<int> {
 protected:
  // The look at what was sent.
  Rule prune_at(int nth) {
    Rule rule = after("HEAD", nth, [this](Response *) { model.drop("/f"); });
    rule.target = "/f/";
    return rule;
  }
  // What the server says of a lock on what is not there.
  static Rule lock_answer(int nth) {
    Rule rule = refusal("LOCK", "/f/", GetParam());
    rule.first = rule.last = nth;
    if (GetParam() == 201) rule.fault.answer.headers["Lock-Token"] = "<made>";
    return rule;
  }
};

TEST_P(PrunedFolder, IsMadeAgain) {
  model.put("/f/p", "x");
  ASSERT_EQ(cloud.get(kObject, BACKUP_TRANS_OPTION_BASIS), "<12>");
  server.set_rules({prune_at(1), lock_answer(1)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(model.content(), (Content{{kObject, "new"}}));
  EXPECT_EQ(model.locks(), 0U);
}

TEST_P(PrunedFolder, IsMadeAgainOnce) {
  ASSERT_EQ(cloud.get(kObject, BACKUP_TRANS_OPTION_BASIS), "<12>");
  Rule always = lock_answer(1);
  always.last = front::kForEver;
  server.set_rules({always});
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(requests("PUT", "/f/"), 2);
}

TEST_P(PrunedFolder, OfAServerThatCannotMoveIsMadeAgain) {
  model.refuse("MOVE", 501);
  ASSERT_EQ(cloud.put("/g", "x"), 0);
  ASSERT_EQ(cloud.get(kObject, BACKUP_TRANS_OPTION_BASIS), "<12>");
  Rule prune = after("MKCOL", 1, [this](Response *) { model.drop("/f"); });
  prune.target = "/f/";
  server.set_rules({prune, lock_answer(1)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(model.content(), (Content{{"/g", "x"}, {kObject, "new"}}));
}

// The parent of a folder that is deleted.
class Parent : public DavTest {
 protected:
  void expect_kept_with(const std::string &folder, const std::string &name) {
    model.put(folder + name, "x");
    expect_kept(folder, {{folder + name, "x"}});
  }
  void expect_kept(const std::string &folder, const Content &content) {
    model.put(folder + "sub/o", "y");
    EXPECT_EQ(cloud.drop(folder + "sub"), 0);
    EXPECT_EQ(model.content(), content);
    EXPECT_EQ(model.locks(), 0U);
  }
  // The server tells of something more in its listings.
  void add_to_listings(const std::string &response) {
    Rule more{"PROPFIND", "/f/"};
    more.fault.spoil = front::Spoil::edit;
    more.fault.edit = [response](Response *answer) {
      const std::size_t end = answer->body.rfind("</multistatus>");
      if (end != std::string::npos) answer->body.insert(end, response);
    };
    server.set_rules({more});
  }
};

TEST_F(Parent, GoesWhenItIsEmpty) { expect_kept("/f/", {}); }

TEST_F(Parent, StaysForANameThatIsNoText) { expect_kept_with("/f/", "\xff\xfe"); }

TEST_F(Parent, StaysForAPathThatIsTooLong) {
  const std::string part = "/" + std::string(250, 'x');
  expect_kept_with(part + part + part + "/", "too-long-a-name");
}

TEST_F(Parent, StaysForANameWithASlash) {
  add_to_listings("<response><href>/dav/f/a%2Fb</href></response>");
  expect_kept("/f/", {{"/f/", ""}});
}

TEST_F(Parent, StaysForWhatCannotBeLookedAt) {
  add_to_listings(
      "<response><href>/dav/f/a</href><status>HTTP/1.1 403 Forbidden</status></response>");
  expect_kept("/f/", {{"/f/", ""}});
}

// What lies about for a day is deleted by whoever lists it, but not for as long as a server likes.
class Leftovers : public Parent {
 protected:
  void have(int count) {
    std::string responses;
    for (int i = 0; i < count; ++i) {
      char digits[25];
      g_snprintf(digits, sizeof digits, "%024x", static_cast<unsigned>(i));
      responses += std::string("<response><href>/dav/f/.quarn-part-") + digits +
                   "</href><propstat><prop><getlastmodified>Mon, 01 Jan 2001 00:00:00 GMT"
                   "</getlastmodified></prop></propstat></response>";
    }
    Rule more{"PROPFIND", "/f/"};
    more.fault.spoil = front::Spoil::edit;
    more.fault.edit = [responses](Response *answer) {
      answer->headers["Date"] = "Sun, 22 Nov 2026 12:00:00 GMT";
      answer->body.insert(answer->body.rfind("</multistatus>"), responses);
    };
    server.set_rules({more, deletion_});
    model.put("/f/o", "x");
  }
  void list() {
    const AnswerPtr answer = cloud.list("/f");
    ASSERT_TRUE(cloud.settle());
    EXPECT_EQ(answer->code, 0);
  }

  Rule deletion_{"DELETE", "/f/"};
};

TEST_F(Leftovers, GoWithAListing) {
  have(3);
  list();
  EXPECT_EQ(requests("DELETE", "/f/"), 3);
}

TEST_F(Leftovers, OfAnyNumberAreSixtyFourRequestsAListing) {
  have(5000);
  list();
  EXPECT_EQ(requests("DELETE", "/f/"), 64);
}

TEST_F(Leftovers, WaitForTheNextListingWhereTheServerIsLost) {
  deletion_.fault.spoil = front::Spoil::reset_response;
  have(5000);
  list();
  EXPECT_LE(requests("DELETE", "/f/"), 2) << "the HTTP library itself repeats one";
}

// Each worker may ask for one, and together they would not fit the daemon.
TEST_F(DavTest, OnlySoManyLongAnswersAreInMemoryAtATime) {
  model.put("/f/long", std::string(3U << 20, 'x'));
  model.put("/f/short", std::string(1U << 20, 'x'));
  transport::HttpRequest request;
  request.method = "GET";
  request.user = DavModel::kUser;
  request.password = "right";
  const std::string base = "http://127.0.0.1:" + std::to_string(server.port()) + DavModel::kRoot;
  const auto ask = [&](const char *path) {
    transport::Ticket ticket;
    request.url = base + path;
    return transport::http_perform(ticket, request);
  };
  std::vector<transport::HttpAnswer> answers;
  for (int i = 0; i < transport::kMaxLongAnswers; ++i) {
    answers.push_back(ask("/f/long"));
    EXPECT_TRUE(answers.back().good()) << answers.back().problem.message;
  }
  const transport::HttpAnswer refused = ask("/f/long");
  EXPECT_EQ(refused.problem.message, "the server's answers are too long together");
  EXPECT_TRUE(refused.problem.transient);
  EXPECT_TRUE(ask("/f/short").good());
  answers.pop_back();
  EXPECT_TRUE(ask("/f/long").good());
  EXPECT_TRUE(ask("/f/long").good()) << "one that nobody has any more takes no room";
}

INSTANTIATE_TEST_SUITE_P(Answers, PrunedFolder, ::testing::Values(404, 409, 201));

}  // namespace
