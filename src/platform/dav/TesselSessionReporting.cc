// The reporting request: a report stored on the share as an XML property
// list named by the computer it describes.
#include "platform/dav/TesselSession.h"
#include "platform/plist/PlistCodec.h"

DavTransaction TesselSession::_sendReportingInfo(const vtc::Dictionary& report,
                                                 const std::string& reportsPath,
                                                 const std::string& name) {
  const std::string xml = vtc::plist::toXml(vtc::Value(report));
  const vtc::Bytes body(xml.begin(), xml.end());
  const std::string path = reportsPath + "/" + name + ".plist";
  DavTransaction t = putData(body, path);
  // The first report of the account: no collection yet. Servers name a
  // missing parent 409 (Apache) or 404 (SabreDAV).
  if (t.httpStatusCode() == 409 || t.httpStatusCode() == 404) {
    mkcol(reportsPath);
    t = putData(body, path);
  }
  return t;
}
