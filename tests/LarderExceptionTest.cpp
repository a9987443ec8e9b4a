#include "LarderException.h"

#include <gtest/gtest.h>

#include <climits>
#include <exception>
#include <stdexcept>
#include <string>
#include <type_traits>

#include "Future.h"
#include "support/GroupingLocale.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;

template <class Caught, class Thrown> bool catches(const Thrown& thrown) {
  try {
    throw thrown;
  } catch (const Caught&) {
    return true;
  } catch (...) {
    return false;
  }
}

TEST(LarderException, ComposesItsTextFromDomainCodeAndDescription) {
  const LarderException exception("went wrong", "Domain", 42);
  EXPECT_STREQ(exception.what(), "domain: Domain; code: 42; description: went wrong .");
  EXPECT_STREQ(exception.domain(), "Domain");
  EXPECT_EQ(exception.code(), 42);
  EXPECT_STREQ(exception.description(), "went wrong");
}

TEST(LarderException, AnEmptyDescriptionKeepsTheWholeFrameWithTwoBlanks) {
  EXPECT_STREQ(LarderException("", "D", 0).what(), "domain: D; code: 0; description:  .");
}

TEST(LarderException, AnEmptyDomainKeepsTheWholeFrame) {
  EXPECT_STREQ(LarderException("text", "", 1).what(), "domain: ; code: 1; description: text .");
}

TEST(LarderException, NegativeAndExtremeCodesArePrintedWithTheirSign) {
  EXPECT_STREQ(LarderException("t", "D", -1).what(), "domain: D; code: -1; description: t .");
  EXPECT_STREQ(LarderException("t", "D", INT_MIN).what(), "domain: D; code: -2147483648; description: t .");
  EXPECT_STREQ(LarderException("t", "D", INT_MAX).what(), "domain: D; code: 2147483647; description: t .");
}

TEST(LarderException, TheCodeIsPrintedPlainlyWhateverTheProcessLocale) {
  const test::GroupingLocale locale;
  EXPECT_STREQ(LarderException("t", "D", 1234567).what(), "domain: D; code: 1234567; description: t .");
}

TEST(LarderException, TheRuntimeErrorInsideCarriesTheDescriptionAlone) {
  const LarderException exception("the description", "Domain", 5);
  EXPECT_STREQ(exception.std::runtime_error::what(), "the description");
}

TEST(LarderException, WhatGivesTheComposedTextThroughTheStandardBaseToo) {
  const FileUtilsIoException exception(2, "gone");
  const std::exception& base = exception;
  EXPECT_STREQ(base.what(), "domain: QZLarderIoErrorErrorDomain; code: 2; description: gone .");
}

TEST(LarderException, AccessorsNeverThrow) {
  EXPECT_TRUE(noexcept(std::declval<const LarderException&>().what()));
  EXPECT_TRUE(noexcept(std::declval<const LarderException&>().domain()));
  EXPECT_TRUE(noexcept(std::declval<const LarderException&>().code()));
  EXPECT_TRUE(noexcept(std::declval<const LarderException&>().description()));
}

TEST(LarderException, ConfigurationExceptionHasItsDomainAndCodeZero) {
  EXPECT_STREQ(ConfigurationException("bad json").what(),
               "domain: QZConfigurationErrorDomain; code: 0; description: bad json .");
}

TEST(LarderException, FileUtilsIoExceptionTakesTheCodeFirstAndSaysErrorTwiceInItsDomain) {
  const FileUtilsIoException exception(13, "no access");
  EXPECT_STREQ(exception.what(), "domain: QZLarderIoErrorErrorDomain; code: 13; description: no access .");
  EXPECT_EQ(exception.code(), 13);
}

TEST(LarderException, DiskCacheManifestExceptionIsBuiltThroughTheBaseConstructor) {
  const DiskCacheManifestException exception("not loaded", "QZDiskCacheManifestErrorDomain", 0);
  EXPECT_STREQ(exception.what(), "domain: QZDiskCacheManifestErrorDomain; code: 0; description: not loaded .");
}

TEST(LarderException, ManifestExceptionsShareOneDomain) {
  EXPECT_STREQ(ManifestPersistenceException("m", 7).what(),
               "domain: QZManifestPersistenceErrorDomain; code: 7; description: m .");
  EXPECT_STREQ(ManifestCorruptedException("m", 26).what(),
               "domain: QZManifestPersistenceErrorDomain; code: 26; description: m .");
}

TEST(LarderException, PlainAndCorruptedSQLiteExceptionsShareTheCorruptedDomain) {
  EXPECT_STREQ(SQLiteStoreException("s", -1).what(),
               "domain: QZSQLiteStoreCorruptedErrorDomain; code: -1; description: s .");
  EXPECT_STREQ(SQLiteStoreCorruptedException("s", 11).what(),
               "domain: QZSQLiteStoreCorruptedErrorDomain; code: 11; description: s .");
}

TEST(LarderException, InvalidatedExceptionHasItsDomainAndCodeZero) {
  EXPECT_STREQ(InvalidatedException("Store has been invalidated.").what(),
               "domain: QZInvalidatedExceptionErrorDomain; code: 0; description: Store has been invalidated. .");
}

TEST(LarderException, CatchingTheRootCatchesTheWholeFamily) {
  EXPECT_TRUE(catches<LarderException>(ConfigurationException("")));
  EXPECT_TRUE(catches<LarderException>(FileUtilsIoException(0, "")));
  EXPECT_TRUE(catches<LarderException>(DiskCacheManifestException("", "", 0)));
  EXPECT_TRUE(catches<LarderException>(ManifestPersistenceException("", 0)));
  EXPECT_TRUE(catches<LarderException>(ManifestCorruptedException("", 0)));
  EXPECT_TRUE(catches<LarderException>(SQLiteStoreException("", 0)));
  EXPECT_TRUE(catches<LarderException>(SQLiteStoreCorruptedException("", 0)));
  EXPECT_TRUE(catches<LarderException>(InvalidatedException("")));
}

TEST(LarderException, CatchingABaseCatchesItsCorruptedSubclassAndNotTheReverse) {
  EXPECT_TRUE(catches<ManifestPersistenceException>(ManifestCorruptedException("", 0)));
  EXPECT_FALSE(catches<ManifestCorruptedException>(ManifestPersistenceException("", 0)));
  EXPECT_TRUE(catches<SQLiteStoreException>(SQLiteStoreCorruptedException("", 0)));
  EXPECT_FALSE(catches<SQLiteStoreCorruptedException>(SQLiteStoreException("", 0)));
  EXPECT_FALSE(catches<SQLiteStoreException>(ManifestCorruptedException("", 0)));
}

TEST(LarderException, FutureErrorIsNoMemberOfTheFamily) {
  EXPECT_FALSE((std::is_base_of_v<LarderException, FutureError>));
  EXPECT_TRUE((std::is_base_of_v<std::logic_error, FutureError>));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
