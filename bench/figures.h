// The summary figures that follow Google Benchmark's table: each compares
// the rate of one benchmark (the loader's side) with that of another (the
// peer's) of the same run. A bench file declares its figures next to its
// benchmarks; main prints them all once the table is done.
#pragma once

#include <functional>
#include <string>
#include <vector>

struct Figure {
  std::string name;    // as the issues name it, e.g. "lzss-vs-inflate"
  std::string loader;  // the full name of the loader's benchmark
  std::string peer;    // the full name of the peer's benchmark
};

// Registers a figure; call it from a BenchSuite's body.
void AddFigure(const std::string &name, const std::string &loader, const std::string &peer);

// A group of benchmarks of one bench file. `setup` checks the contenders
// against each other and registers benchmarks and figures; it returns false
// when a contender disagrees with its peer, and then nothing is measured.
struct BenchSuite {
  BenchSuite(const char *name, std::function<bool()> setup);
};

// Runs every suite's setup (main calls it once).
bool SetUpSuites();
const std::vector<Figure> &Figures();
