// What was measured: told at once, and kept for the files.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/Value.hpp"

namespace bench {

struct Figure {
  double p50, p99;
};
Figure percentiles(std::vector<double> times);

// Figures outside tables, measured once.
void report(const std::string& what, Figure figure, const char* unit);
void report(const std::string& what, double figure, const char* unit);
// One of each server.
void report(const std::string& what, const std::vector<double>& figures, const char* unit);

enum class Better { less, more };

// Rows of one subject: ours, and the peers' beside them. Each round measures all of them, so that a ratio is
// one of neighbours in time.
class Table {
 public:
  Table(std::string name, std::string title, std::string unit, Better better);

  // One round's figure.
  void add(const std::string& row, const std::string& column, double figure);
  void add(const std::string& row, Figure figure);
  // `aim` is the most that ours may be times the peer's, or the least where more is better.
  void compare(const std::string& row, const std::string& column, const std::string& peer,
               std::optional<double> aim = std::nullopt);
  // The same of ours alone.
  void watch(const std::string& row, const std::string& column, std::optional<double> aim = std::nullopt);
  // As Markdown: of each cell the median of its rounds, its least and its most; then what is compared with
  // others or an aim, and the picture.
  void print() const;

  platform::Dictionary figures() const;
  // What a later run is compared with, by what it is called.
  platform::Dictionary comparisons() const;
  // What gnuplot makes a picture of.
  std::string drawing() const;

 private:
  struct Comparison {
    std::string row, column, peer;  // without a peer it is ours alone
    std::optional<double> aim;
  };
  using Rounds = std::vector<double>;

  Rounds compared(const Comparison& comparison) const;
  std::string label(const Comparison& comparison) const;
  const Rounds* cell(const std::string& row, const std::string& column) const;

  const std::string name, title, unit;
  const Better better;
  std::vector<std::string> rows, columns;  // in the order of their first figures
  std::map<std::string, std::map<std::string, Rounds>> cells;
  std::vector<Comparison> watched;
};

// Made at the first call; `name` is its picture's. While everything is pinned, both say so.
Table& table(const std::string& name, const std::string& title, const std::string& unit,
             Better better = Better::less);

// What the figures were measured under.
void setCondition(const std::string& name, const platform::Value& value);
// Everything so far: FOLDER/NAME.json, and a .gp of each table.
void writeReport(const std::string& folder, const std::string& name);
// Prints what became worse from one file to the other by more than either's rounds differ among themselves.
void compareReports(const std::string& before, const std::string& after);

}  // namespace bench
