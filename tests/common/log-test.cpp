#include "common/log.h"

#include <gtest/gtest.h>

#include "log-capture.h"

namespace {

using plovo_test::LogCapture;

TEST(LogTest, HandlerAndLibraryPrefixes) {
  LogCapture log;
  const int line = __LINE__ + 1;
  PLOVO_LOG(LOG_ERR, "Unknown action '%s'", "List");
  PLOVO_LIB_ERR("Failed to open '%s'", "db");
  PLOVO_LIB_DBG("plain");
  auto lines = log.Lines();
  ASSERT_EQ(lines.size(), 3u);
  EXPECT_EQ(lines[0].priority, LOG_ERR);
  EXPECT_EQ(lines[0].text, "log-test.cpp:" + std::to_string(line) + " Unknown action 'List'");
  EXPECT_EQ(lines[1].text,
            "[ERR] log-test(" + std::to_string(line + 1) + "): Failed to open 'db'");
  EXPECT_EQ(lines[2].priority, LOG_DEBUG);
  EXPECT_EQ(lines[2].text, "[DBG] log-test(" + std::to_string(line + 2) + "): plain");
}

TEST(LogTest, LongLinesAreNotCut) {
  LogCapture log;
  const std::string big(5000, 'x');
  Plovo::LogWrite(LOG_WARNING, "%s", big.c_str());
  ASSERT_EQ(log.Lines().size(), 1u);
  EXPECT_EQ(log.Lines()[0].text, big);
}

}  // namespace
