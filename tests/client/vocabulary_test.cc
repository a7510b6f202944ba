#include "quarvel/vocabulary.hpp"

#include <gtest/gtest.h>

#include "Statistics/ZQReportingUtility.h"

namespace quarvel {
namespace {

// Clients do not link the service, so both have the names; here they meet.
TEST(ClientVocabulary, NamesEveryCodeAsTheServiceDoes) {
  for (std::uint32_t low = 0; low <= 0xffff; ++low) {
    const auto code = static_cast<std::uint16_t>(low);
    EXPECT_EQ(vocabulary::NameOf(vocabulary::MessageType{code}), ZQReportingUtilityTypeName(code));
    EXPECT_EQ(vocabulary::NameOf(vocabulary::ServiceType{code}),
              ZQReportingUtilityServiceTypeName(code));
    for (const std::uint32_t high :
         {0U, 0x0800U, 0x1000U, 0x2000U, 0x4000U, 0x8000U, 1U, 0xffffU}) {
      const std::uint32_t category = high << 16 | low;
      EXPECT_EQ(vocabulary::NameOf(vocabulary::Category(category)),
                ZQReportingUtilityCategoryName(category));
    }
  }
}

}  // namespace
}  // namespace quarvel
