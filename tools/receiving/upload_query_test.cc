#include "tools/receiving/upload_query.h"

#include <gmock/gmock.h>

namespace tarnel::lab {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

constexpr char kDescriptionParameter[] = "description=Lumora%20AFRC%20log%20(Uploaded%20by%20QMX)";

std::string queryOf(const std::string& filename) {
  return "uuid=0123456789abcdef&sequence=77&" + std::string(kDescriptionParameter) + "&filename=" + filename +
         "&raw=true";
}

std::vector<std::string> problemsWith(const std::string& query) {
  Problems problems;
  checkUploadQuery(readUploadQuery(query), problems);
  return problems.take();
}

TEST(UploadQueryTest, EveryParameterIsDecoded) {
  const UploadQuery query = readUploadQuery(queryOf("a%20b.log.gz"));
  EXPECT_EQ(query, (UploadQuery{.uuid = "0123456789abcdef",
                                .sequence = "77",
                                .description = "Lumora AFRC log (Uploaded by QMX)",
                                .filename = "a b.log.gz",
                                .raw = "true"}));
  EXPECT_THAT(problemsWith(queryOf("a%20b.log.gz")), IsEmpty());
}

TEST(UploadQueryTest, FileNamesMayLookLikeTheQueryAroundThem) {
  for (const std::string name : {"a&b.gz", "a+b.gz", "x=1&y=2.gz", "&raw=true.gz", "raw=.gz", "a?b.gz",
                                 "&sequence=5&description=x.gz", "100%25.gz", "%C3%BC.gz"}) {
    const UploadQuery query = readUploadQuery(queryOf(name));
    EXPECT_EQ(query.uuid, "0123456789abcdef") << name;
    EXPECT_EQ(query.raw, "true") << name;
    EXPECT_THAT(problemsWith(queryOf(name)), IsEmpty()) << name;
  }
  EXPECT_EQ(readUploadQuery(queryOf("a&b+c.gz")).filename, "a&b+c.gz");
  EXPECT_EQ(readUploadQuery(queryOf("100%25.gz")).filename, "100%.gz");
  EXPECT_EQ(readUploadQuery(queryOf("&raw=true.gz")).filename, "&raw=true.gz");
}

TEST(UploadQueryTest, WhatIsNoEscapeStaysAsItIs) {
  for (const std::string name : {"%", "%2", "%zz", "a%", "%%"}) {
    EXPECT_EQ(readUploadQuery(queryOf(name)).filename, name);
  }
}

TEST(UploadQueryTest, WhatIsMissingIsNamed) {
  EXPECT_THAT(problemsWith(""),
              ElementsAre("query: uuid: missing", "query: sequence: missing", "query: description: missing",
                          "query: filename: missing", "query: raw: missing"));
  EXPECT_EQ(readUploadQuery("filename=x.gz").filename, "x.gz");
  EXPECT_EQ(readUploadQuery("raw=1").raw, "1");
}

TEST(UploadQueryTest, WrongValuesAreNamed) {
  EXPECT_THAT(problemsWith("uuid=&sequence=-1&description=x&filename=%2Fetc%2Fpasswd&raw=false"),
              ElementsAre("query: uuid: must have 1 to 40 bytes, but is \"\"",
                          "query: sequence: must be a number of 32 bits, but is \"-1\"",
                          "query: description: must be \"Lumora AFRC log (Uploaded by QMX)\", but is \"x\"",
                          "query: filename: \"/etc/passwd\" names a folder",
                          "query: filename: \"/etc/passwd\" must be a name that ends in .gz",
                          "query: raw: must be \"true\", but is \"false\""));
  EXPECT_THAT(problemsWith("uuid=" + std::string(41, 'a') + "&sequence=4294967296&description=d&raw=true"),
              ElementsAre(HasSubstr("1 to 40 bytes"), HasSubstr("4294967296"), HasSubstr("description"),
                          "query: filename: missing"));
  EXPECT_THAT(problemsWith(queryOf(".gz")), ElementsAre(HasSubstr("must be a name that ends in .gz")));
  EXPECT_THAT(problemsWith(queryOf("%FF.gz")), ElementsAre("query: filename: \"?.gz\" is not UTF-8"));
}

}  // namespace
}  // namespace tarnel::lab
