// PROPFIND, PROPPATCH, listings and attributes.
#include <ne_basic.h>
#include <ne_dates.h>
#include <ne_props.h>
#include <ne_xml.h>
#include <ne_xmlreq.h>

#include <cstdlib>
#include <cstring>
#include <functional>

#include "VantorSyncManager/PublicNames.h"
#include "common/Format.h"
#include "common/Limits.h"
#include "platform/dav/DavConnection.h"
#include "platform/dav/DavMultistatus.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/LockRecord.h"
#include "platform/dav/TesselSession.h"
#include "platform/dav/XmlTree.h"

namespace {

const std::vector<std::string> kBasicProperties = {"DAV:getlastmodified", "DAV:getcontentlength",
                                                   "DAV:getetag", "DAV:resourcetype"};

// Sends one PROPFIND and, when a multistatus answer was parsed, hands its
// entries (valid only during the call) to onParsed.
DavTransaction runPropfind(
    vtc::DavConnection& conn, const std::string& path, int32_t depth,
    const std::vector<std::string>& props,
    const std::function<void(DavTransaction&, std::vector<vtc::PropfindEntry>&)>& onParsed) {
  std::string escaped = vtc::davpath::escape(path);
  std::string body = vtc::propfindBody(props);
  ne_xml_parser* parser = ne_xml_create();
  vtc::XmlTreeBuilder builder(parser);
  bool parsed = false;
  DavTransaction t = conn.perform("PROPFIND", path, [&] {
    ne_request* req = ne_request_create(conn.session(), "PROPFIND", escaped.c_str());
    ne_add_depth_header(req, depth == 0 ? NE_DEPTH_ZERO : NE_DEPTH_ONE);
    ne_set_request_body_buffer(req, body.data(), body.size());
    ne_add_request_header(req, "Content-Type", "application/xml");
    int ret = ne_xml_dispatch_request(req, parser);
    if (ret == NE_OK && ne_get_status(req)->code != 207) ret = NE_ERROR;
    if (ret == NE_OK && (ne_xml_failed(parser) || !builder.root())) ret = NE_ERROR;
    parsed = ret == NE_OK;
    ne_request_destroy(req);
    return ret;
  });
  if (parsed) {
    std::vector<vtc::PropfindEntry> entries = vtc::readMultistatus(*builder.root());
    onParsed(t, entries);
  } else if (t.transactionState() == vtc::kTransactionCompleted &&
             !vtc::overLimitIn(t.errorText())) {
    // An answer, but not one of WebDAV: say what came instead.
    const int status = t.httpStatusCode();
    const char* xmlError = ne_xml_failed(parser) ? ne_xml_get_error(parser) : nullptr;
    if (xmlError && vtc::overLimitIn(xmlError))
      t.setErrorText(xmlError);
    else if (status / 100 == 2 && status != 207)
      t.setErrorText(vtc::format(
          "the answer to PROPFIND was not WebDAV: HTTP %d where a 207 multistatus was expected",
          status));
    else if (status == 207)
      t.setErrorText(
          vtc::format("the answer to PROPFIND was not WebDAV: its XML cannot be read (%@)",
                      vtc::clipped(xmlError ? xmlError : "no root element", 200)));
  }
  ne_xml_destroy(parser);
  return t;
}

vtc::Dictionary attributesOf(const vtc::PropfindEntry& entry) {
  vtc::Dictionary a;
  a.set(kNBURI, vtc::Value(entry.path));
  if (const vtc::Value* modified = entry.properties.find("DAV:getlastmodified")) {
    time_t t = ne_httpdate_parse(modified->string().c_str());
    if (t != static_cast<time_t>(-1))
      a.set(kNBLastModified, vtc::Value(std::chrono::system_clock::from_time_t(t)));
  }
  if (const vtc::Value* length = entry.properties.find("DAV:getcontentlength"))
    a.set(kNBContentLength,
          vtc::Value(static_cast<long long>(std::atoll(length->string().c_str()))));
  if (const vtc::Value* etag = entry.properties.find(vtc::kDavETag)) a.set(vtc::kDavETag, *etag);
  const vtc::Value* type = entry.properties.find("DAV:resourcetype");
  a.set(vtc::kDavIsCollection,
        vtc::Value(type && type->string().find("collection") != std::string::npos));
  return a;
}

// Fills in a lock that its discovery shows without an owner from the lock
// record beside it: the lock its token names, or, where the discovery hides
// tokens, the one lock there is.
vtc::Array withLockRecord(vtc::Array locks, const vtc::Dictionary& properties) {
  const vtc::Value* text = properties.find(vtc::kLockRecordProperty);
  const std::optional<vtc::LockRecord> record =
      text ? vtc::LockRecord::parse(text->string()) : std::nullopt;
  if (!record) return locks;
  for (vtc::Value& value : locks) {
    vtc::Dictionary& lock = value.mutableDictionary();
    const std::string token = lock.get("token").string();
    const bool itsLock = token.empty() ? locks.size() == 1 : token == record->token;
    if (!itsLock || !lock.get("owner").string().empty()) continue;
    lock.set("owner", vtc::Value(record->owner));
    lock.merge(vtc::ownerFields(record->owner));
    if (token.empty()) lock.set("token", vtc::Value(record->token));
    lock.set("recorded", vtc::Value(true));
  }
  return locks;
}

}  // namespace

DavTransaction TesselSession::propfind(const std::string& path, int32_t depth,
                                       const std::vector<std::string>& props,
                                       bool includingParent) {
  const std::string self = vtc::davpath::canonical(path);
  return atCollectionPath(path, [&](const std::string& at) {
    return runPropfind(*connection_, at, depth, props, [&](DavTransaction& t, auto& entries) {
      vtc::Dictionary result;
      for (auto& entry : entries) {
        if (!includingParent && depth > 0 && vtc::davpath::canonical(entry.path) == self) continue;
        result.set(entry.href, vtc::Value(std::move(entry.properties)));
      }
      t.setResult(vtc::Value(std::move(result)));
    });
  });
}

DavTransaction TesselSession::_issuePropFindAtPath(const std::string& path, int32_t depth,
                                                   const std::vector<std::string>& props,
                                                   bool includingParent) {
  return propfind(path, depth, props, includingParent);
}

DavTransaction TesselSession::_issuePropFindAtPath(const std::string& path, int32_t depth,
                                                   const std::vector<std::string>& props) {
  return propfind(path, depth, props, true);
}

DavTransaction TesselSession::_issuePropPatchAtPath(const std::string& path,
                                                    const vtc::Dictionary& props,
                                                    const std::string& nameSpace) {
  std::vector<ne_propname> names;
  std::vector<std::string> values;
  names.reserve(props.size());
  values.reserve(props.size());
  for (const auto& [name, value] : props) {
    names.push_back({nameSpace.c_str(), name.c_str()});
    // neon sends values as they are: escape them for XML here.
    values.push_back(vtc::xmlEscape(value.isString() ? value.string() : value.description()));
  }
  std::vector<ne_proppatch_operation> ops;
  size_t i = 0;
  for (const auto& [name, value] : props) {
    const bool remove = value.isString() && value.string() == kNBRemoveProp;
    ops.push_back(
        {&names[i], remove ? ne_propremove : ne_propset, remove ? nullptr : values[i].c_str()});
    ++i;
  }
  ops.push_back({nullptr, ne_propset, nullptr});
  return atCollectionPath(path, [&](const std::string& at) {
    const std::string escaped = vtc::davpath::escape(at);
    return connection_->perform("PROPPATCH", at, [&] {
      return ne_proppatch(connection_->session(), escaped.c_str(), ops.data());
    });
  });
}

DavTransaction TesselSession::attributes(const std::string& path, int32_t depth, bool withLocks) {
  std::vector<std::string> props = kBasicProperties;
  if (withLocks) props.insert(props.end(), {vtc::kDavLockDiscovery, vtc::kLockRecordProperty});
  const std::string self = vtc::davpath::canonical(path);
  // A listing is of a collection: asked for as one.
  const std::string asked = depth > 0 ? vtc::davpath::collection(path) : path;
  return atCollectionPath(asked, [&](const std::string& at) {
    return runPropfind(*connection_, at, depth, props, [&](DavTransaction& t, auto& entries) {
      if (depth == 0) {
        vtc::Dictionary a;
        if (!entries.empty()) {
          a = attributesOf(entries.front());
          if (withLocks && entries.front().lockDiscovery)
            a.set(vtc::kDavLockDiscovery,
                  vtc::Value(withLockRecord(vtc::readActiveLocks(*entries.front().lockDiscovery),
                                            entries.front().properties)));
          if (const vtc::Value* record = entries.front().properties.find(vtc::kLockRecordProperty))
            a.set(vtc::kLockRecordProperty, *record);
        }
        t.setResult(vtc::Value(std::move(a)));
        return;
      }
      vtc::Array members;
      for (const auto& entry : entries) {
        if (vtc::davpath::canonical(entry.path) == self) continue;
        members.push_back(vtc::Value(attributesOf(entry)));
      }
      t.setResult(vtc::Value(std::move(members)));
    });
  });
}

DavTransaction TesselSession::basicAttributesAtPath(const std::string& path) {
  return attributes(path, 0, false);
}

DavTransaction TesselSession::extendedAttributesAtPath(const std::string& path) {
  return attributes(path, 0, true);
}

DavTransaction TesselSession::listCollectionAtPath(const std::string& path) {
  return attributes(path, 1, false);
}
