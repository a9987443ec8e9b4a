#pragma once

#include <locale>
#include <string>

namespace velmora::mobile::xplat::cellar::test {

// While it lives the process writes 1234567 as "1.234.567", as many hosts' locales do.
class GroupingLocale {
 public:
  GroupingLocale() : before_(std::locale::global(std::locale(std::locale::classic(), new Grouping))) {}
  GroupingLocale(const GroupingLocale&) = delete;
  GroupingLocale& operator=(const GroupingLocale&) = delete;
  ~GroupingLocale() { std::locale::global(before_); }

 private:
  class Grouping : public std::numpunct<char> {
    char do_thousands_sep() const override { return '.'; }
    std::string do_grouping() const override { return "\3"; }
  };

  std::locale before_;
};

}  // namespace velmora::mobile::xplat::cellar::test
