#include "host/package_writer.h"

#include <archive.h>
#include <archive_entry.h>
#include <sys/stat.h>

#include <memory>

namespace appsync {

namespace {

// Before 1980 in every time zone: the archive's own times, which are local ones, then all say 1980-01-01.
constexpr time_t kEntryTime = 0;

la_ssize_t appendTo(archive*, void* bytes, const void* more, std::size_t size) {
  static_cast<std::string*>(bytes)->append(static_cast<const char*>(more), size);
  return static_cast<la_ssize_t>(size);
}

bool writeEntry(archive* writer, const PackageEntry& content) {
  const std::unique_ptr<archive_entry, decltype(&archive_entry_free)> entry(archive_entry_new(), &archive_entry_free);
  const bool isDirectory = content.path.ends_with('/');
  archive_entry_set_pathname_utf8(entry.get(), content.path.c_str());
  archive_entry_set_filetype(entry.get(), isDirectory ? S_IFDIR : S_IFREG);
  archive_entry_set_perm(entry.get(), isDirectory || content.executable ? 0755 : 0644);
  archive_entry_set_size(entry.get(), static_cast<la_int64_t>(content.content.size()));
  archive_entry_set_mtime(entry.get(), kEntryTime, 0);
  if (archive_write_header(writer, entry.get()) != ARCHIVE_OK) return false;
  return content.content.empty() || archive_write_data(writer, content.content.data(), content.content.size()) ==
                                        static_cast<la_ssize_t>(content.content.size());
}

}  // namespace

std::optional<std::string> packageBytes(const std::vector<PackageEntry>& entries) {
  const std::unique_ptr<archive, decltype(&archive_write_free)> writer(archive_write_new(), &archive_write_free);
  std::string bytes;
  if (archive_write_set_format_zip(writer.get()) != ARCHIVE_OK ||
      archive_write_set_format_option(writer.get(), "zip", "compression", "deflate") != ARCHIVE_OK ||
      archive_write_set_format_option(writer.get(), "zip", "hdrcharset", "UTF-8") != ARCHIVE_OK ||
      archive_write_set_bytes_in_last_block(writer.get(), 1) != ARCHIVE_OK ||
      archive_write_open(writer.get(), &bytes, nullptr, appendTo, nullptr) != ARCHIVE_OK) {
    return std::nullopt;
  }
  for (const PackageEntry& entry : entries) {
    if (!writeEntry(writer.get(), entry)) return std::nullopt;
  }
  if (archive_write_close(writer.get()) != ARCHIVE_OK) return std::nullopt;
  return bytes;
}

}  // namespace appsync
