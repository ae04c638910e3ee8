// Everything that the client asks of the world, given to it by its host.
#pragma once

#include <string>

namespace appsync {

class BrelmShell;
class DovelDeviceService;
class FileManager;
class IconServices;
class InstallTransactionLog;
class KilnInstaller;
class NotificationCenter;
class NotificationService;
class OstrelService;
class PellumApplicationWorkspace;
class SystemLog;
class TessaProfileConnection;
class VaultryService;
class Waiting;

// No pointer is null. Lifetime: first the client is destroyed, then the services are drained (no callback of theirs
// runs any more, none is to come), then they are destroyed.
struct Platform {
  std::string mainBundleIdentifier;  // of the process that hosts the client

  SystemLog* log = nullptr;
  InstallTransactionLog* transactionLog = nullptr;
  FileManager* files = nullptr;
  Waiting* waiting = nullptr;
  PellumApplicationWorkspace* defaultWorkspace = nullptr;
  OstrelService* coordination = nullptr;
  KilnInstaller* installer = nullptr;
  VaultryService* backup = nullptr;
  TessaProfileConnection* sharedConnection = nullptr;
  BrelmShell* shell = nullptr;
  IconServices* icons = nullptr;
  NotificationService* notifications = nullptr;
  NotificationCenter* notificationCenter = nullptr;
  DovelDeviceService* sharedInstance = nullptr;  // of the daemon's device service
};

}  // namespace appsync
