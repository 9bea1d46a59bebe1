#include "client/run/ServerView.h"

#include <cstdlib>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/Format.h"
#include "platform/dav/DavPaths.h"
#include "session/DataclassName.h"

namespace vtc::client {

namespace {

std::optional<int64_t> version(const Value* v) {
  if (!v || !v->isString() || v->string().empty()) return std::nullopt;
  return v->integer();
}

}  // namespace

DataclassRecord DataclassRecord::fromRecord(const Dictionary& record) {
  DataclassRecord r;
  r.minversion = version(record.find("minversion"));
  r.maxversion = version(record.find("maxversion"));
  r.status = record.get("status").string();
  r.etag = record.get("DAV:getetag").string();
  // "<index>:<digest>"; anything else is no digest.
  if (const Value* digest = record.find("truthdigest"); digest && digest->isString()) {
    const std::string& text = digest->string();
    const size_t colon = text.find(':');
    char* end = nullptr;
    const long long index = colon == std::string::npos ? 0 : std::strtoll(text.c_str(), &end, 10);
    if (index > 0 && end == text.c_str() + colon) {
      r.truthIndex = index;
      r.truthDigest = text.substr(colon + 1);
    }
  }
  for (auto [key, field] : {std::pair{"collectionname", &r.collectionName},
                            std::pair{"collectioncolor", &r.collectionColor}})
    if (const Value* v = record.find(key); v && v->isString() && !v->string().empty())
      *field = v->string();
  // A server whose collections carry no entity tag: the record's own values
  // change with every commit, reset and repair, so they stand in for one.
  if (r.etag.empty() || r.etag == kNoETag)
    r.etag = format("record %@ %@ %@ %@", record.get("minversion"), record.get("maxversion"),
                    record.get("status"), record.get("lastsync"));
  return r;
}

ServerView ServerView::read(NubiloRemoteSession& session) {
  std::vector<std::string> properties = session.dataclassRecordProperties();
  for (const char* meta : {"collectionname", "collectioncolor"})
    properties.push_back(session.syncNamespace() + meta);
  DavTransaction t = session._issuePropFindWithRetryAtPath(
      davpath::collection(session.schemasPath()), kDAVOneDepth, properties);
  if (!t.isSuccessful())
    throw NubiloException(NubiloTransactionFailureException,
                          format("The dataclass records could not be read %@", t));
  ServerView view;
  const std::string& ns = session.syncNamespace();
  const std::string self = davpath::canonical(session.schemasPath());
  for (const auto& [href, properties] : t.result().dictionary()) {
    const std::string path = davpath::canonical(davpath::fromHref(href));
    if (path == self || !isPlainDataclassName(davpath::lastComponent(path))) continue;
    Dictionary record;
    for (const auto& [name, value] : properties.dictionary())
      if (name.size() > ns.size() && name.compare(0, ns.size(), ns) == 0)
        record.set(name.substr(ns.size()), value);
    if (const Value* etag = properties.dictionary().find("DAV:getetag"))
      record.set("DAV:getetag", *etag);
    view.records_[davpath::lastComponent(path)] = DataclassRecord::fromRecord(record);
  }
  return view;
}

std::optional<DataclassRecord> ServerView::record(const std::string& dataclass) const {
  auto it = records_.find(dataclass);
  if (it == records_.end()) return std::nullopt;
  return it->second;
}

NetworkState NetworkState::fromValue(const Value& value) {
  const Dictionary& d = value.dictionary();
  NetworkState s;
  if (const Value* i = d.find("Index")) s.index = i->integer();
  if (const Value* m = d.find("MinVersion")) s.minversion = m->integer();
  return s;
}

Value NetworkState::toValue() const {
  Dictionary d;
  if (index) d.set("Index", Value(*index));
  if (minversion) d.set("MinVersion", Value(*minversion));
  return Value(d);
}

}  // namespace vtc::client
