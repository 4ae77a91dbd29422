#include "bench/Report.hpp"

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <functional>
#include <iterator>
#include <limits>
#include <memory>
#include <sstream>
#include <stdexcept>
#include <utility>

#include "bench/Process.hpp"
#include "platform/linux/Json.hpp"

namespace bench {
namespace {

using platform::Dictionary;
using platform::List;
using platform::Value;

Dictionary loose, conditions;
std::vector<std::pair<std::string, std::unique_ptr<Table>>> tables;

struct Spread {
  double median, least, most;
};
Spread spread(std::vector<double> rounds) {
  std::sort(rounds.begin(), rounds.end());
  return {rounds.at(rounds.size() / 2), rounds.front(), rounds.back()};
}

std::string shown(double figure) {
  char text[32];
  const int decimals = figure < 9.95 ? 2 : figure < 99.5 ? 1 : 0;
  std::snprintf(text, sizeof text, "%.*f", decimals, figure);
  return text;
}
std::string shown(const std::vector<double>& rounds) {
  const Spread all = spread(rounds);
  std::string text = shown(all.median);
  if (rounds.size() > 1) text += " (" + shown(all.least) + "–" + shown(all.most) + ")";
  return text;
}

void remember(std::vector<std::string>& names, const std::string& name) {
  if (std::find(names.begin(), names.end(), name) == names.end()) names.push_back(name);
}

List listOf(const std::vector<double>& rounds) { return List(rounds.begin(), rounds.end()); }

bool isNumber(const std::string& text) { return text.find_first_not_of("0123456789") == text.npos; }

void writeText(const std::string& path, const std::string& text) {
  if (!(std::ofstream(path) << text << std::flush)) throw std::runtime_error("cannot write " + path);
}

Dictionary comparisonsIn(const std::string& path) {
  std::ostringstream text;
  text << std::ifstream(path).rdbuf();
  std::string problem;
  const auto parsed = platform::linux_::parseJson(text.str(), problem);
  const auto* whole = parsed ? parsed->as<Dictionary>() : nullptr;
  const auto* compared = whole ? platform::find<Dictionary>(*whole, "compared") : nullptr;
  if (!compared) throw std::runtime_error(path + ": no report of this program " + problem);
  return *compared;
}

std::vector<double> roundsOf(const Dictionary& comparison) {
  std::vector<double> rounds;
  const auto* list = platform::find<List>(comparison, "rounds");
  for (const Value& each : list ? *list : List()) {
    if (const auto* figure = each.as<double>()) rounds.push_back(*figure);
  }
  return rounds;
}

}  // namespace

Figure percentiles(std::vector<double> times) {
  std::sort(times.begin(), times.end());
  const std::size_t rank = (times.size() * 99 + 99) / 100;
  return {times.at(times.size() / 2), times.at(rank - 1)};
}

void report(const std::string& what, Figure figure, const char* unit) {
  std::printf("%-46s p50 %9.1f %s   p99 %9.1f %s\n", what.c_str(), figure.p50, unit, figure.p99, unit);
  std::fflush(stdout);
  loose.emplace(what, Dictionary{{"p50", figure.p50}, {"p99", figure.p99}, {"unit", unit}});
}

void report(const std::string& what, double figure, const char* unit) {
  std::printf("%-46s %13.2f %s\n", what.c_str(), figure, unit);
  std::fflush(stdout);
  loose.emplace(what, Dictionary{{"value", figure}, {"unit", unit}});
}

void report(const std::string& what, const std::vector<double>& figures, const char* unit) {
  std::printf("%-46s", what.c_str());
  for (const double figure : figures) std::printf(" %13.2f", figure);
  std::printf(" %s\n", unit);
  std::fflush(stdout);
  loose.emplace(what, Dictionary{{"each", listOf(figures)}, {"unit", unit}});
}

Table::Table(std::string name_, std::string title_, std::string unit_, Better better_)
    : name(std::move(name_)), title(std::move(title_)), unit(std::move(unit_)), better(better_) {}

void Table::add(const std::string& row, const std::string& column, double figure) {
  std::fputc('.', stderr);  // for who waits
  remember(rows, row);
  remember(columns, column);
  cells[row][column].push_back(figure);
}

void Table::add(const std::string& row, Figure figure) {
  add(row, "p50", figure.p50);
  add(row, "p99", figure.p99);
}

void Table::compare(const std::string& row, const std::string& column, const std::string& peer,
                    std::optional<double> aim) {
  watched.push_back({row, column, peer, aim});
}

void Table::watch(const std::string& row, const std::string& column, std::optional<double> aim) {
  watched.push_back({row, column, "", aim});
}

const Table::Rounds* Table::cell(const std::string& row, const std::string& column) const {
  const auto found = cells.find(row);
  if (found == cells.end()) return nullptr;
  const auto rounds = found->second.find(column);
  return rounds == found->second.end() ? nullptr : &rounds->second;
}

Table::Rounds Table::compared(const Comparison& comparison) const {
  const Rounds* own = cell(comparison.row, comparison.column);
  const Rounds* peer = comparison.peer.empty() ? nullptr : cell(comparison.peer, comparison.column);
  if (!own || (!peer && !comparison.peer.empty()))
    throw std::runtime_error("not measured: " + label(comparison));
  Rounds result = *own;
  if (peer) std::transform(own->begin(), own->end(), peer->begin(), result.begin(), std::divides<>());
  return result;
}

std::string Table::label(const Comparison& comparison) const {
  return comparison.row + (comparison.peer.empty() ? "" : " / " + comparison.peer) + ", " + comparison.column;
}

void Table::print() const {
  std::string text = "\n**" + title + "**" + (unit.empty() ? "" : ", in " + unit) + ":\n\n|";
  for (const auto& column : columns) text += " | " + column;
  text += " |\n|---|";
  for (std::size_t count = 0; count < columns.size(); ++count) text += "---|";
  for (const auto& row : rows) {
    text += "\n| " + row + " |";
    for (const auto& column : columns) {
      const Rounds* rounds = cell(row, column);
      text += (rounds ? " " + shown(*rounds) : "") + " |";
    }
  }
  bool isFirst = true;
  for (const Comparison& comparison : watched) {
    if (comparison.peer.empty() && !comparison.aim) continue;  // the table has it
    if (std::exchange(isFirst, false)) text += "\n\n| compared | | aim | |\n|---|---|---|---|";
    const Rounds rounds = compared(comparison);
    const double median = spread(rounds).median;
    const auto& aim = comparison.aim;
    const bool isMet = better == Better::less ? median <= aim : median >= aim;
    text += "\n| " + label(comparison) + " | " + shown(rounds) + " | ";
    if (aim) text += (better == Better::less ? "≤ " : "≥ ") + shown(*aim);
    text += std::string(" | ") + (aim ? isMet ? "met" : "**missed**" : "") + " |";
  }
  std::printf("%s\n\n![%s](performance/%s.svg)\n", text.c_str(), title.c_str(), name.c_str());
  std::fflush(stdout);
}

Dictionary Table::figures() const {
  Dictionary found;
  for (const auto& [row, ofRow] : cells) {
    Dictionary rounds;
    for (const auto& [column, ofColumn] : ofRow) rounds.emplace(column, listOf(ofColumn));
    found.emplace(row, std::move(rounds));
  }
  return {{"title", title}, {"unit", unit}, {"rows", std::move(found)}};
}

Dictionary Table::comparisons() const {
  Dictionary found;
  for (const Comparison& comparison : watched) {
    found.emplace(title + ": " + label(comparison), Dictionary{{"rounds", listOf(compared(comparison))},
                                                               {"lessIsBetter", better == Better::less}});
  }
  return found;
}

std::string Table::drawing() const {
  const bool isCurve = std::all_of(columns.begin(), columns.end(), isNumber);
  const auto quoted = [](const std::string& text) { return "\"" + text + "\""; };
  double least = std::numeric_limits<double>::infinity(), most = 0;
  for (const auto& row : rows) {
    for (const auto& column : columns) {
      if (!cell(row, column)) continue;
      least = std::min(least, spread(*cell(row, column)).median);
      most = std::max(most, spread(*cell(row, column)).median);
    }
  }
  // A scale of powers has no place for 0, and bars on one have no length that says anything.
  const bool isOfPowers = least > 0 && (isCurve || most / least > 100);
  std::ostringstream text;
  text << "set terminal svg size 760,420 font 'sans-serif,12' background '#ffffff'\nset title "
       << quoted(title) << "\nset ylabel " << quoted(unit)
       << (isOfPowers ? "\nset logscale y" : "\nset yrange [0:1<*]")
       << "\nset grid ytics lc rgb '#dddddd'\nset border 3\n"
          "set key outside bottom center horizontal\n";
  if (isCurve) {
    text << "set logscale x\nset xtics nomirror (";
    for (const auto& column : columns) text << (&column == &columns.front() ? "" : ", ") << column;
    text << ")\n";
  } else {
    text << "set style data histograms\nset style fill solid 0.8\nset xtics nomirror rotate by -20\n";
  }
  text << "$data << END\n";
  const auto& down = isCurve ? columns : rows;
  const auto& across = isCurve ? rows : columns;
  for (const auto& line : down) {
    text << (isCurve ? line : quoted(line));
    for (const auto& each : across) {
      const Rounds* rounds = isCurve ? cell(each, line) : cell(line, each);
      text << ' ' << (rounds ? std::to_string(spread(*rounds).median) : "NaN");
    }
    text << '\n';
  }
  text << "END\nplot ";
  for (std::size_t index = 0; index < across.size(); ++index) {
    const std::string column = std::to_string(index + 2);
    text << (index ? ", " : "") << "$data using ";
    text << (isCurve ? "1:" + column + " with linespoints lw 2 pt 7 ps 0.6" : column + ":xtic(1)");
    text << " title " << quoted(across[index]);
  }
  text << '\n';
  return text.str();
}

Table& table(const std::string& name, const std::string& title, const std::string& unit, Better better) {
  const std::string own = name + (isPinned() ? "-pinned" : "");
  for (const auto& [known, made] : tables) {
    if (known == own) return *made;
  }
  const std::string full = title + (isPinned() ? ", pinned" : "");
  tables.emplace_back(own, std::make_unique<Table>(own, full, unit, better));
  return *tables.back().second;
}

void setCondition(const std::string& name, const Value& value) {
  std::printf("%s: %s\n", name.c_str(), platform::describe(value).c_str());
  conditions.insert_or_assign(name, value);
}

void writeReport(const std::string& folder, const std::string& name) {
  Dictionary all, comparisons;
  for (const auto& [known, made] : tables) {
    all.emplace(known, made->figures());
    comparisons.merge(made->comparisons());
    writeText(folder + "/" + known + ".gp", made->drawing());
  }
  Dictionary whole{{"conditions", conditions}, {"figures", loose}};
  if (!all.empty()) whole.insert({{"tables", std::move(all)}, {"compared", std::move(comparisons)}});
  const auto text = platform::linux_::printJson(whole, platform::linux_::JsonStyle::indented);
  if (!text) throw std::runtime_error("a figure is no number");
  writeText(folder + "/" + name + ".json", *text + "\n");
}

void compareReports(const std::string& before, const std::string& after) {
  const Dictionary old = comparisonsIn(before), now = comparisonsIn(after);
  std::size_t worse = 0, alike = 0, others = 0;
  for (const auto& [label, value] : now) {
    const auto* found = platform::find<Dictionary>(old, label);
    const auto earlier = found ? roundsOf(*found) : std::vector<double>();
    const auto later = roundsOf(*value.as<Dictionary>());
    if (earlier.size() < 3 || later.size() < 3) {  // nothing is known of their noise
      ++others;
      continue;
    }
    const Spread was = spread(earlier), is = spread(later);
    const auto* lessIsBetter = platform::find<bool>(*found, "lessIsBetter");
    const bool isWorse = lessIsBetter && *lessIsBetter ? is.least > was.most : is.most < was.least;
    ++(isWorse ? worse : alike);
    if (isWorse)
      std::printf("worse: %s: %s, was %s\n", label.c_str(), shown(later).c_str(), shown(earlier).c_str());
  }
  for (const auto& entry : old) others += !now.contains(entry.first);
  std::printf("%zu worse than the noise, %zu not; %zu without rounds in both files\n", worse, alike, others);
}

}  // namespace bench
