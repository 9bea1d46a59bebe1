#include "client/items/ItemCheck.h"

#include <libical/ical.h>

#include <algorithm>
#include <memory>
#include <mutex>

#include "client/items/ContentLines.h"
#include "client/items/ItemText.h"
#include "common/Format.h"

namespace vtc::client {

namespace {

struct ComponentFree {
  void operator()(icalcomponent* c) const { icalcomponent_free(c); }
};
using Component = std::unique_ptr<icalcomponent, ComponentFree>;

void libicalOnce() {
  static std::once_flag once;
  // A library error must come back as a problem, never end the process.
  std::call_once(once, [] { icalerror_set_errors_are_fatal(0); });
}

std::string componentLabel(icalcomponent* c) {
  const char* kind = icalcomponent_kind_to_string(icalcomponent_isa(c));
  const char* uid = icalcomponent_get_uid(c);
  return format("%s %s", kind ? kind : "component", uid ? uid : "without UID");
}

// The rules libical leaves to its callers.
void checkTimes(icalcomponent* c, std::vector<std::string>& problems) {
  const icalcomponent_kind kind = icalcomponent_isa(c);
  if (kind != ICAL_VEVENT_COMPONENT && kind != ICAL_VTODO_COMPONENT) return;
  icalproperty* start = icalcomponent_get_first_property(c, ICAL_DTSTART_PROPERTY);
  if (!start) return;
  const icaltimetype begins = icalproperty_get_dtstart(start);
  icalproperty* end = icalcomponent_get_first_property(
      c, kind == ICAL_VEVENT_COMPONENT ? ICAL_DTEND_PROPERTY : ICAL_DUE_PROPERTY);
  if (end) {
    const icaltimetype ends =
        kind == ICAL_VEVENT_COMPONENT ? icalproperty_get_dtend(end) : icalproperty_get_due(end);
    if (icaltime_is_null_time(begins) || icaltime_is_null_time(ends)) return;
    if (begins.is_date != ends.is_date)
      problems.push_back(componentLabel(c) + " mixes a date and a date-time for its times");
    else if (icaltime_compare(ends, begins) < 0)
      problems.push_back(componentLabel(c) + " ends before it starts");
  }
  if (icalproperty* d = icalcomponent_get_first_property(c, ICAL_DURATION_PROPERTY)) {
    if (end) problems.push_back(componentLabel(c) + " has both an end and a duration");
    if (icalproperty_get_duration(d).is_neg)
      problems.push_back(componentLabel(c) + " has a negative duration");
  }
}

void checkCalendar(std::string_view bytes, std::vector<std::string>& problems) {
  libicalOnce();
  const std::string text(bytes);
  Component calendar(icalparser_parse_string(text.c_str()));
  if (!calendar) {
    problems.push_back("libical cannot read it");
    return;
  }
  for (icalcomponent* c = icalcomponent_get_first_component(calendar.get(), ICAL_ANY_COMPONENT); c;
       c = icalcomponent_get_next_component(calendar.get(), ICAL_ANY_COMPONENT)) {
    for (icalproperty* e = icalcomponent_get_first_property(c, ICAL_XLICERROR_PROPERTY); e;
         e = icalcomponent_get_next_property(c, ICAL_XLICERROR_PROPERTY))
      problems.push_back(componentLabel(c) + ": " + icalproperty_get_xlicerror(e));
    checkTimes(c, problems);
  }
  for (icalproperty* e = icalcomponent_get_first_property(calendar.get(), ICAL_XLICERROR_PROPERTY);
       e; e = icalcomponent_get_next_property(calendar.get(), ICAL_XLICERROR_PROPERTY))
    problems.push_back(std::string("the calendar: ") + icalproperty_get_xlicerror(e));
}

void checkCard(const ItemText& text, std::vector<std::string>& problems) {
  std::string version;
  bool fn = false;
  for (const ItemUnit& unit : text.units) {
    if (unit.role != ItemUnit::Role::Property) continue;
    if (unit.name == "VERSION")
      for (const ContentLine& line : readContentLines(unit.raw))
        if (!line.blank()) version = std::string(lineValue(line.text()));
    if (unit.name == "FN") fn = true;
  }
  version.erase(0, version.find_first_not_of(" \t"));
  version.erase(version.find_last_not_of(" \t") + 1);
  if (version.empty())
    problems.push_back("it has no VERSION");
  else if (version != "2.1" && !fn)
    problems.push_back("it has no FN");
}

}  // namespace

std::vector<std::string> itemProblems(ItemKind kind, std::string_view bytes) {
  std::vector<std::string> problems;
  std::string problem;
  std::optional<ItemText> text = readItemText(kind, bytes, &problem);
  if (!text) return {problem};
  if (kind == ItemKind::Contacts)
    checkCard(*text, problems);
  else
    checkCalendar(bytes, problems);
  return problems;
}

std::optional<std::string> newProblem(ItemKind kind, std::string_view merged,
                                      const std::vector<std::string_view>& inputs) {
  std::vector<std::string> problems = itemProblems(kind, merged);
  if (problems.empty()) return std::nullopt;
  std::vector<std::string> known;
  for (std::string_view input : inputs)
    for (std::string& p : itemProblems(kind, input)) known.push_back(std::move(p));
  for (const std::string& p : problems)
    if (std::find(known.begin(), known.end(), p) == known.end()) return p;
  return std::nullopt;
}

}  // namespace vtc::client
