#include "Report.h"

#include <array>
#include <cstdio>
#include <nlohmann/json.hpp>

namespace {

constexpr std::array kUnitNames{"seconds", "bytes", "share", "count"};  // in the enumeration's order

std::string scaled(double value, Unit unit) {
  char text[32];
  if (unit == Unit::bytes) {
    std::snprintf(text, sizeof text, "%.1f MiB", value / (1 << 20));
  } else if (unit == Unit::count) {
    std::snprintf(text, sizeof text, "%.0f", value);
  } else if (unit == Unit::share) {
    std::snprintf(text, sizeof text, "%.3f %%", value * 100);
  } else if (value < 1e-6) {
    std::snprintf(text, sizeof text, "%.0f ns", value * 1e9);
  } else if (value < 1e-3) {
    std::snprintf(text, sizeof text, "%.2f us", value * 1e6);
  } else {
    std::snprintf(text, sizeof text, "%.2f ms", value * 1e3);
  }
  return text;
}

std::string number(double value) {
  char text[32];
  std::snprintf(text, sizeof text, "%.2f", value);
  return text;
}

std::string line(const std::array<std::string, 6>& cells) {
  char text[256];
  std::snprintf(text, sizeof text, "%-62s %12s %12s %7s %6s %4s\n", cells[0].c_str(), cells[1].c_str(),
                cells[2].c_str(), cells[3].c_str(), cells[4].c_str(), cells[5].c_str());
  return text;
}

std::string line(const Row& row) {
  return line({row.metric, scaled(row.ours, row.unit), scaled(row.reference, row.unit), number(row.ratio()),
               row.goal ? number(*row.goal) : "-",
               !row.goal   ? "-"
               : row.met() ? "yes"
                           : "NO"});
}

}  // namespace

void Report::add(Row row) {
  std::fputs(line(row).c_str(), stderr);
  _rows.push_back(std::move(row));
}

std::string Report::table() const {
  std::string text = line({"metric", "ours", "peer/limit", "ratio", "goal", "met"});
  for (const Row& row : _rows) text += row.point ? "" : line(row);
  return text;
}

std::string Report::json() const {
  auto list = nlohmann::ordered_json::array();
  for (const Row& row : _rows) {
    nlohmann::ordered_json entry{
        {"metric", row.metric}, {"ours", row.ours}, {"reference", row.reference}, {"ratio", row.ratio()}};
    entry["goal"] = row.goal ? nlohmann::ordered_json(*row.goal) : nlohmann::ordered_json();
    entry["met"] = row.goal ? nlohmann::ordered_json(row.met()) : nlohmann::ordered_json();
    entry["unit"] = kUnitNames.at(static_cast<std::size_t>(row.unit));
    if (row.point) entry.update({{"series", row.point->series}, {"x", row.point->x}});
    list.push_back(std::move(entry));
  }
  return list.dump(2) + "\n";
}
