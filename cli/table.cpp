/* Lays answers out in columns. No lock. */
#include "cli/table.h"

#include <algorithm>
#include <sstream>

namespace cli {
namespace {

constexpr size_t kGap = 2;          /* between columns */
constexpr size_t kLongestName = 16; /* longer ones are cut */
constexpr const char *kBold = "\033[1m";
constexpr const char *kGreen = "\033[32m";
constexpr const char *kYellow = "\033[33m";
constexpr const char *kPlain = "\033[0m";

struct Cell {
  std::string text;
  const char *colour = nullptr;
};

/* The cells stand each in their column; the flow begins in the next one and may span the rest. */
struct Row {
  std::vector<Cell> cells;
  std::string flow;
};

/* UTF-8: every byte but the continuing ones begins a character. */
bool beginsCharacter(char byte) {
  return (static_cast<unsigned char>(byte) & 0xc0) != 0x80;
}

/* In characters, not bytes. */
size_t lengthOf(const std::string &text) {
  return static_cast<size_t>(std::count_if(text.begin(), text.end(), beginsCharacter));
}

std::string shortName(const std::string &name) {
  std::string text = printable(name);
  if (lengthOf(text) <= kLongestName) return text;
  size_t characters = 0;
  size_t end = 0;
  while (end < text.size() && (!beginsCharacter(text[end]) || ++characters < kLongestName)) end++;
  return text.substr(0, end) + "…";
}

std::string versionText(const KARSTResolverNodeLocators &set) {
  return std::to_string(set.majorVersion) + "." + std::to_string(set.minorVersion);
}

Row rowOf(const Answer &answer, const Names &names, bool withNames) {
  const Target &target = answer.target;
  const bool resolved = answer.locators.has_value();
  Row row;
  row.cells.push_back({kindOf(target) + " " + host::toString(target.uuid)});
  if (withNames) row.cells.push_back({shortName(nameOf(names, target.uuid))});
  row.cells.push_back({resolved ? "resolved" : "unresolved", resolved ? kGreen : kYellow});
  if (!resolved) {
    row.flow = printable(answer.reason);
    return row;
  }
  const KARSTResolverNodeLocators &set = *answer.locators;
  const std::string nodeName = nameOf(names, set.nodeUUID);
  row.cells.push_back({nodeName.empty() ? host::toString(set.nodeUUID) : shortName(nodeName)});
  row.cells.push_back({versionText(set)});
  row.cells.push_back({std::to_string(set.trafficType)});
  row.flow = locatorsText(set);
  return row;
}

Row headingOf(bool withNames) {
  Row row{{{"TARGET", kBold}}, "LOCATORS"};
  if (withNames) row.cells.push_back({"NAME", kBold});
  for (const char *title : {"STATE", "NODE", "VERSION", "TRAFFIC"}) {
    row.cells.push_back({title, kBold});
  }
  return row;
}

/* The widths of the columns that cells stand in. */
std::vector<size_t> widthsOf(const std::vector<Row> &rows) {
  std::vector<size_t> widths;
  for (const Row &row : rows) {
    if (widths.size() < row.cells.size()) widths.resize(row.cells.size());
    for (size_t i = 0; i < row.cells.size(); i++) {
      widths[i] = std::max(widths[i], lengthOf(row.cells[i].text));
    }
  }
  return widths;
}

/* The words from column `start` on, in as many lines as they need. */
std::string flowText(const std::string &flow, size_t start) {
  std::istringstream words(flow);
  std::string text;
  std::string word;
  size_t column = start;
  while (words >> word) {
    const size_t length = lengthOf(word);
    if (column > start && column + 1 + length > kTableWidth) {
      text += "\n" + std::string(start, ' ');
      column = start;
    }
    if (column > start) {
      text += ' ';
      column++;
    }
    text += word;
    column += length;
  }
  return text;
}

std::string rowText(const Row &row, const std::vector<size_t> &widths, bool colour) {
  std::string text;
  size_t column = 0;
  for (size_t i = 0; i < row.cells.size(); i++) {
    const Cell &cell = row.cells[i];
    const bool coloured = colour && cell.colour != nullptr;
    text += coloured ? cell.colour + cell.text + kPlain : cell.text;
    text += std::string(widths[i] - lengthOf(cell.text) + kGap, ' ');
    column += widths[i] + kGap;
  }
  return text + flowText(row.flow, column) + "\n";
}

}  // namespace

std::string toTable(const std::vector<Answer> &answers, const Names &names, bool colour) {
  const bool withNames = std::any_of(answers.begin(), answers.end(), [&](const Answer &answer) {
    return !nameOf(names, answer.target.uuid).empty();
  });
  std::vector<Row> rows{headingOf(withNames)};
  for (const Answer &answer : answers) rows.push_back(rowOf(answer, names, withNames));
  const std::vector<size_t> widths = widthsOf(rows);
  std::string text;
  for (const Row &row : rows) text += rowText(row, widths, colour);
  return text;
}

std::string stateText(bool resolved, bool colour) {
  std::string text = resolved ? "resolved" : "unresolved";
  if (!colour) return text;
  return (resolved ? kGreen : kYellow) + text + kPlain;
}

std::string detailText(const Answer &answer, const Names &names) {
  if (!answer.locators) return printable(answer.reason);
  const KARSTResolverNodeLocators &set = *answer.locators;
  return printable(nameOrUUID(names, set.nodeUUID)) + " " + versionText(set) + ", traffic type " +
         std::to_string(set.trafficType) + ": " + locatorsText(set);
}

std::string printable(const std::string &name) {
  std::string text;
  for (size_t i = 0; i < name.size(); i++) {
    const auto byte = static_cast<unsigned char>(name[i]);
    /* Terminals obey the controls of Latin 1 too; as UTF-8 these are 0xc2 and a byte below 0xa0. */
    const bool highControl =
        byte == 0xc2 && i + 1 < name.size() && static_cast<unsigned char>(name[i + 1]) < 0xa0;
    if (highControl) i++;
    text += highControl || byte < 0x20 || byte == 0x7f ? '?' : name[i];
  }
  return text;
}

}  // namespace cli
