// What was measured: one row a metric, each beside a peer or a limit from the same run.
#pragma once

#include <optional>
#include <string>
#include <vector>

enum class Unit { seconds, bytes, share, count };

// Where a row stands in a curve: it is for plots then, and not in the table.
struct Point {
  std::string series;
  double x;
};

struct Row {
  std::string metric;
  double ours;
  double reference;
  Unit unit;
  std::optional<double> goal;    // the largest ratio that is good; none: for information
  std::optional<Point> point{};  // none: a row of the table

  double ratio() const { return ours / reference; }
  bool met() const { return !goal || ratio() <= *goal; }
};

class Report {
 public:
  // Enters a row and says on standard error that it is there.
  void add(Row row);
  // The table, for people.
  std::string table() const;
  // A list of objects: "metric", "ours", "reference", "ratio", "goal", "met", "unit", and "series" and "x" of a point.
  // Seconds, bytes, or a share of a core.
  std::string json() const;

 private:
  std::vector<Row> _rows;
};
