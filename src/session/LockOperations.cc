// The named locks: this client, any client, all clients, one dataclass, all
// dataclasses.
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/StringAdditions.h"
#include "common/Logging.h"
#include "session/DataclassName.h"

std::string NubiloRemoteSession::clientPath(const std::string& guid) const {
  return stringByAppendingTesselPathComponent(_clientsPath, guid + ".client");
}

std::string NubiloRemoteSession::dataclassLockPath(const std::string& dataclass) const {
  vtc::requirePlainDataclassName(dataclass);
  return stringByAppendingTesselPathComponent(_schemasPath, dataclass) + "/";
}

void NubiloRemoteSession::lockClient() {
  lockClient(_configuration.get("guid").string());
}

void NubiloRemoteSession::lockClient(const std::string& guid) {
  VTC_LOG_INFO("Locking client %@", guid);
  try {
    _lockResourceAtPath(clientPath(guid));
  } catch (const NubiloException& e) {
    if (e.name() != NubiloResourceNotFoundException) throw;
    throw NubiloException(NubiloClientRegistrationException,
                          vtc::format("Attempting to lock a client that doesn't exist, %@", guid));
  }
}

void NubiloRemoteSession::unlockClient() {
  unlockClient(_configuration.get("guid").string());
}

void NubiloRemoteSession::unlockClient(const std::string& guid) {
  _unlockResourceAtPath(clientPath(guid));
  VTC_LOG_INFO("Unlocking client %@", guid);
}

void NubiloRemoteSession::relockClient() {
  relockClient(_configuration.get("guid").string());
}

void NubiloRemoteSession::relockClient(const std::string& guid) {
  _relockResourceAtPath(clientPath(guid));
  VTC_LOG_INFO("Relocking client %@", guid);
}

void NubiloRemoteSession::lockClients() {
  _lockResourceAtPath(_clientsPath + "/");
  VTC_LOG_INFO("Locking all clients");
}

void NubiloRemoteSession::unlockClients() {
  _unlockResourceAtPath(_clientsPath + "/");
  VTC_LOG_INFO("Unlocking all clients");
}

void NubiloRemoteSession::relockClients() {
  _relockResourceAtPath(_clientsPath + "/");
  VTC_LOG_INFO("Relocking all clients");
}

void NubiloRemoteSession::lockDataclass(const std::string& dataclass) {
  _lockResourceAtPath(dataclassLockPath(dataclass));
  VTC_LOG_INFO("Locking dataclass %@", dataclass);
}

void NubiloRemoteSession::unlockDataclass(const std::string& dataclass) {
  _unlockResourceAtPath(dataclassLockPath(dataclass));
  VTC_LOG_INFO("Unlocking dataclass %@", dataclass);
}

void NubiloRemoteSession::relockDataclass(const std::string& dataclass) {
  _relockResourceAtPath(dataclassLockPath(dataclass));
  VTC_LOG_INFO("Relocking dataclass %@", dataclass);
}

void NubiloRemoteSession::lockDataclasses() {
  _lockResourceAtPath(_schemasPath + "/");
  VTC_LOG_INFO("Locking all Dataclasses");
}

void NubiloRemoteSession::unlockDataclasses() {
  _unlockResourceAtPath(_schemasPath + "/");
  VTC_LOG_INFO("Unlocking all Dataclasses");
}
