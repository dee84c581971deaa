#include "Statistics/Service/MetricsText.h"

#include <gtest/gtest.h>

namespace tavrin {
namespace {

// Clients past the bound are summed into one series, names are escaped, and every sample line
// has the form a scraper parses.
TEST(MetricsTextTest, ClientSeriesAreBoundedAndLabelsEscaped) {
  const Value status = Value::parse(R"({"totals": {"received": 9, "delivered": 5, "in_flight": 1,
      "dropped": {"no_session": 3}},
    "clients": [
      {"pid": 1, "name": "small", "received": 1, "delivered": 1, "dropped": {"no_session": 1}},
      {"pid": 2, "name": "a \"quoted\\name", "received": 5, "delivered": 3},
      {"pid": 3, "name": "other", "received": 3, "delivered": 1, "dropped": {"no_session": 2}}]})");
  const std::string text = MetricsText(status, 1);
  for (const char* line : {
           "tavrin_messages_received_total{pid=\"2\",name=\"a \\\"quoted\\\\name\"} 5\n",
           "tavrin_messages_received_total{pid=\"0\",name=\"(other)\"} 4\n",
           "tavrin_messages_dropped_total{pid=\"0\",name=\"(other)\",reason=\"no_session\"} 3\n",
           "tavrin_messages_dropped_total{reason=\"no_session\"} 3\n",
       }) {
    EXPECT_NE(text.find(line), std::string::npos) << line << text;
  }
  EXPECT_EQ(text.find("small"), std::string::npos) << "only the busiest client has its own series";
  EXPECT_TRUE(text.ends_with("\n# EOF\n"));
}

}  // namespace
}  // namespace tavrin
