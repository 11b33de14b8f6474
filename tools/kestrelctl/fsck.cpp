#include "fsck.h"

#include <map>

#include "daemon/client_connection.h"
#include "daemon/daemon_state.h"
#include "store/file_manager.h"
#include "store/global_configuration.h"
#include "store/metadata.h"

namespace kestrel::kestrelctl {

namespace {

using Pairs = std::set<std::pair<std::string, std::string>>;

std::vector<std::uint32_t> usersOfClass(KSTContainerClass containerClass) {
  if (KSTIsBundleClass(containerClass)) return {kKSTInstallerUserId};
  if (KSTIsSystemClass(containerClass)) return {kKSTSystemContainerUserId};
  std::vector<std::uint32_t> users;
  KSTForEachValidUserId([&](std::uint32_t user) { users.push_back(user); });
  return users;
}

std::string describe(const Pairs& pairs) {
  std::string text;
  for (const auto& [identifier, uuid] : pairs) {
    if (!text.empty()) text += ", ";
    text += identifier + " " + uuid;
  }
  return text;
}

// One (user, class, transient) directory: its valid containers as pairs.
Pairs checkClassDirectory(const KSTFileURL& directory, std::uint32_t user, FsckReport* report) {
  Pairs found;
  KSTErrorRef listError;
  const auto items =
      KSTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory, &listError);
  if (!items) {
    if (listError && listError->isPOSIXError(ENOENT)) return found;
    report->problems.push_back(
        directory.path() + ": cannot be listed: " + (listError ? listError->description() : "?"));
    return found;
  }
  ++report->classDirectories;
  std::map<std::string, std::vector<std::string>> pathsByIdentifier;
  for (const KSTFileURL& item : *items) {
    KSTErrorRef readError;
    const KSTMetadataRef record =
        KSTMetadata::readAndValidateMetadataAtUrl(item, user, true, &readError);
    if (!record) {
      report->problems.push_back(
          item.path() + ": not a valid container: " + (readError ? readError->description() : "?"));
      continue;
    }
    ++report->containers;
    pathsByIdentifier[record->identifier()].push_back(item.path());
    found.emplace(record->identifier(), record->uuid().string());
  }
  for (const auto& [identifier, paths] : pathsByIdentifier) {
    if (paths.size() < 2) continue;
    std::string line = identifier + " has " + std::to_string(paths.size()) + " containers:";
    for (const std::string& path : paths) line += " " + path;
    report->problems.push_back(line);
  }
  return found;
}

// What the next start does with one replace journal, by what exists now.
void checkJournal(const KSTFileURL& url, bool daemonRunning, FsckReport* report) {
  const KSTFileManager& files = KSTFileManager::defaultManager();
  KSTErrorRef error;
  const std::optional<KSTReplaceJournal> journal =
      KSTClientConnection::sharedClientConnection()._readAndValidateReplaceFileAtUrl(url, &error);
  std::string outcome;
  bool recoverable = true;
  if (!journal) {
    outcome = "invalid (" + (error ? error->description() : std::string("?")) +
              "): the next start discards it";
  } else if (files.itemExistsAtURL(journal->oldURL)) {
    outcome = "swap not begun, or done in place: the next start discards it";
  } else if (files.itemExistsAtURL(journal->destURL)) {
    outcome = "swap done: the next start discards it; the old container waits in staging";
  } else if (files.itemExistsAtURL(journal->stagingURL)) {
    outcome = "old container parked: the next start moves " + journal->stagingURL.path() +
              " back to " + journal->oldURL.path();
  } else {
    outcome =
        "cannot be recovered: neither the old container, the new one nor the parked one "
        "is there";
    recoverable = false;
  }
  const std::string line = url.path() + ": replace journal, " + outcome;
  if (daemonRunning || !recoverable) {
    report->problems.push_back(line);
  } else {
    report->pending.push_back(line);
  }
}

// Replace journals and staging leftovers: interrupted work.
void checkInterruptedWork(bool daemonRunning, FsckReport* report) {
  KSTGlobalConfiguration& layout = KSTGlobalConfiguration::sharedInstance();
  const KSTFileManager& files = KSTFileManager::defaultManager();
  if (const auto journals =
          files.urlsForItemsInDirectoryAtURL(layout.replaceDirectory(), nullptr)) {
    for (const KSTFileURL& journal : *journals) checkJournal(journal, daemonRunning, report);
  }
  if (const auto leftovers =
          files.urlsForItemsInDirectoryAtURL(layout.stagingDirectory(), nullptr)) {
    for (const KSTFileURL& item : *leftovers) {
      if (daemonRunning) {
        report->problems.push_back(item.path() + ": left in staging");
      } else {
        report->pending.push_back(item.path() +
                                  ": left in staging: the next start retires it to death row");
      }
    }
  }
}

}  // namespace

FsckReport checkContainerStore(const ListContainers& listContainers) {
  FsckReport report;
  KSTGlobalConfiguration& layout = KSTGlobalConfiguration::sharedInstance();
  for (KSTContainerClass containerClass = 1; containerClass <= 13; ++containerClass) {
    for (std::uint32_t user : usersOfClass(containerClass)) {
      for (bool transient : {false, true}) {
        const std::optional<KSTFileURL> directory =
            layout.containerDirectoryURLForUser(user, containerClass, transient);
        if (!directory) continue;
        const Pairs onDisk = checkClassDirectory(*directory, user, &report);
        if (!listContainers) continue;
        std::string error;
        const std::optional<Pairs> listed = listContainers(user, containerClass, transient, &error);
        const std::string where = std::string(KSTContainerClassPath(containerClass)) +
                                  (transient ? " (transient)" : "") + " of user " +
                                  std::to_string(user);
        if (!listed) {
          report.problems.push_back(where + ": the daemon could not list it: " + error);
          continue;
        }
        Pairs missing, extra;
        for (const auto& pair : onDisk) {
          if (!listed->count(pair)) missing.insert(pair);
        }
        for (const auto& pair : *listed) {
          if (!onDisk.count(pair)) extra.insert(pair);
        }
        if (!missing.empty()) {
          report.problems.push_back(
              where + ": on disk but not in the daemon's cache: " + describe(missing));
        }
        if (!extra.empty()) {
          report.problems.push_back(where +
                                    ": in the daemon's cache but not on disk: " + describe(extra));
        }
      }
    }
  }

  checkInterruptedWork(static_cast<bool>(listContainers), &report);
  return report;
}

}  // namespace kestrel::kestrelctl
