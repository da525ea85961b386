#include "figures.h"

#include <cstdio>

namespace {

struct Suite {
  const char *name;
  std::function<bool()> setup;
};

std::vector<Suite> &Suites() {
  static std::vector<Suite> suites;
  return suites;
}

std::vector<Figure> &AllFigures() {
  static std::vector<Figure> figures;
  return figures;
}

}  // namespace

void AddFigure(const std::string &name, const std::string &loader, const std::string &peer) {
  AllFigures().push_back({name, loader, peer});
}

BenchSuite::BenchSuite(const char *name, std::function<bool()> setup) {
  Suites().push_back({name, std::move(setup)});
}

bool SetUpSuites() {
  bool ok = true;
  for (const Suite &suite : Suites()) {
    if (!suite.setup()) {
      std::fprintf(stderr, "nimb_bench: suite %s disagrees with its peer; not measured\n", suite.name);
      ok = false;
    }
  }
  return ok;
}

const std::vector<Figure> &Figures() {
  return AllFigures();
}
