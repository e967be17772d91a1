#include "extractors.h"

#include <expat.h>
#include <fcntl.h>
#include <magic.h>
#include <poppler/cpp/poppler-document.h>
#include <poppler/cpp/poppler-global.h>
#include <poppler/cpp/poppler-page.h>
#include <sys/stat.h>
#include <taglib/fileref.h>
#include <taglib/tfilestream.h>
#include <taglib/tpropertymap.h>
#include <unistd.h>
#include <zip.h>

#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <exiv2/exiv2.hpp>
#include <memory>
#include <new>
#include <stdexcept>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/dict.h>
#include <libavutil/log.h>
}

namespace fileindexd {

using fileindex_store::Content;
using fileindex_store::ExtractState;
using fileindex_store::Kind;

namespace {

magic_t g_magic = nullptr;
// What is read of a file whose name suggests no kind to tell its type: enough for the
// signatures of every kind extracted, the member names of a zip included.
constexpr std::size_t kSniffBytes = 16 * 1024;
// Without the pattern tests: a few microseconds where the full look at a text file takes
// milliseconds, and enough to tell text from anything else.
magic_t g_quickMagic = nullptr;

// Names whose files are plain text when their content is text at all.
bool TextExtension(const std::string& path) {
  const std::string::size_type slash = path.rfind('/');
  const std::string extension =
      fileindex_store::ExtensionOf(slash == std::string::npos ? path : path.substr(slash + 1));
  for (const char* text : {"txt", "md", "csv", "log", "tex", "json", "xml", "html", "htm"})
    if (extension == text) return true;
  return false;
}

// A failure whose message becomes the file's reason.
struct ExtractError : std::runtime_error {
  using std::runtime_error::runtime_error;
};

bool StartsWith(const std::string& text, const char* prefix) { return text.rfind(prefix, 0) == 0; }

// Text as valid UTF-8: bytes that are not part of a valid sequence are taken as Latin-1,
// the most common other encoding of plain text. Control characters other than white space
// become spaces.
void AppendUtf8(std::string& out, const char* data, std::size_t size, std::size_t max) {
  std::size_t i = 0;
  while (i < size && out.size() < max) {
    unsigned char c = static_cast<unsigned char>(data[i]);
    std::size_t length = c < 0x80 ? 1 : (c >> 5) == 6 ? 2 : (c >> 4) == 14 ? 3 : (c >> 3) == 30 ? 4 : 0;
    bool valid = length > 0 && i + length <= size;
    for (std::size_t k = 1; valid && k < length; ++k)
      valid = (static_cast<unsigned char>(data[i + k]) & 0xC0) == 0x80;
    if (valid && length == 1) {
      out += (c < 0x20 && c != '\n' && c != '\t' && c != '\r') || c == 0x7F ? ' ' : static_cast<char>(c);
    } else if (valid) {
      if (out.size() + length > max) break;
      out.append(data + i, length);
    } else {
      if (out.size() + 2 > max) break;
      length = 1;
      out += static_cast<char>(0xC0 | (c >> 6));
      out += static_cast<char>(0x80 | (c & 0x3F));
    }
    i += length;
  }
}

std::string Utf8(const char* data, std::size_t size, std::size_t max = 4096) {
  std::string out;
  AppendUtf8(out, data, size, max);
  return out;
}
std::string Utf8(const std::string& text, std::size_t max = 4096) {
  return Utf8(text.data(), text.size(), max);
}

// ---------------------------------------------------------------------------- photo

std::string ExifDate(std::string value) {
  // "2020:07:14 10:11:12" (EXIF) or "2020-07-14T10:11:12[+02:00]" (XMP)
  if (value.size() < 10) return "";
  value[4] = '-';
  value[7] = '-';
  if (value.size() >= 19) {
    value[10] = ' ';
    value.resize(19);
  } else {
    value.resize(10);
  }
  for (std::size_t i = 0; i < value.size(); ++i) {
    char c = value[i];
    bool digit = c >= '0' && c <= '9';
    if (!digit && i != 4 && i != 7 && i != 10 && i != 13 && i != 16) return "";
  }
  if (value.compare(0, 4, "0000") == 0) return "";
  return value;
}

bool GpsCoordinate(const Exiv2::ExifData& exif, const char* key, const char* refKey, double& out) {
  auto it = exif.findKey(Exiv2::ExifKey(key));
  auto ref = exif.findKey(Exiv2::ExifKey(refKey));
  if (it == exif.end() || it->count() < 3) return false;
  double value = 0, scale = 1;
  for (long i = 0; i < 3; ++i, scale *= 60) {
    Exiv2::Rational r = it->toRational(i);
    if (r.second == 0) return false;
    value += static_cast<double>(r.first) / r.second / scale;
  }
  if (ref != exif.end()) {
    std::string direction = ref->toString();
    if (direction == "S" || direction == "W") value = -value;
  }
  if (!std::isfinite(value)) return false;
  out = value;
  return true;
}

void ExtractPhoto(const std::string& path, Content& content) {
  try {
    Exiv2::Image::AutoPtr image = Exiv2::ImageFactory::open(path);
    if (image.get() == nullptr) throw ExtractError("not an image Exiv2 reads");
    image->readMetadata();
    content.width = image->pixelWidth();
    content.height = image->pixelHeight();
    const Exiv2::ExifData& exif = image->exifData();
    auto exifText = [&exif](const char* key) {
      auto it = exif.findKey(Exiv2::ExifKey(key));
      return it == exif.end() ? std::string() : Utf8(it->toString(), 256);
    };
    const Exiv2::XmpData& xmp = image->xmpData();
    auto xmpText = [&xmp](const char* key) {
      auto it = xmp.findKey(Exiv2::XmpKey(key));
      return it == xmp.end() ? std::string() : Utf8(it->toString(), 256);
    };
    content.taken = ExifDate(exifText("Exif.Photo.DateTimeOriginal"));
    if (content.taken.empty()) content.taken = ExifDate(xmpText("Xmp.exif.DateTimeOriginal"));
    if (content.taken.empty()) content.taken = ExifDate(exifText("Exif.Image.DateTime"));
    content.make = exifText("Exif.Image.Make");
    if (content.make.empty()) content.make = xmpText("Xmp.tiff.Make");
    content.model = exifText("Exif.Image.Model");
    if (content.model.empty()) content.model = xmpText("Xmp.tiff.Model");
    content.title = xmpText("Xmp.dc.title");
    if (StartsWith(content.title, "lang=")) content.title = content.title.substr(content.title.find(' ') + 1);
    if (content.width == 0) {
      std::string width = exifText("Exif.Photo.PixelXDimension"),
                  height = exifText("Exif.Photo.PixelYDimension");
      content.width = std::atoll(width.c_str());
      content.height = std::atoll(height.c_str());
    }
    content.hasPosition =
        GpsCoordinate(exif, "Exif.GPSInfo.GPSLatitude", "Exif.GPSInfo.GPSLatitudeRef", content.latitude) &&
        GpsCoordinate(exif, "Exif.GPSInfo.GPSLongitude", "Exif.GPSInfo.GPSLongitudeRef", content.longitude);
  } catch (const Exiv2::AnyError& error) {
    // Exiv2 names the file it was given, here a descriptor's name that means nothing later.
    std::string message = error.what();
    if (message.compare(0, path.size() + 2, path + ": ") == 0) message.erase(0, path.size() + 2);
    throw ExtractError("Exiv2: " + message);
  }
}

// ---------------------------------------------------------------------------- audio

// An ID3v2 tag says its size in its first ten bytes; a tag larger than the limit is refused
// before TagLib reads (and allocates) it.
void CheckId3Size(int fd, const ExtractLimits& limits) {
  unsigned char header[10];
  if (::pread(fd, header, sizeof(header), 0) != static_cast<ssize_t>(sizeof(header))) return;
  if (std::memcmp(header, "ID3", 3) != 0) return;
  std::uint64_t size = 0;
  for (int i = 6; i < 10; ++i) size = (size << 7) | (header[i] & 0x7F);
  if (size > limits.maxTagBytes)
    throw ExtractError("ID3v2 tag of " + std::to_string(size >> 20) + " MiB exceeds the limit of " +
                       std::to_string(limits.maxTagBytes >> 20) + " MiB");
}

void ExtractAudio(int fd, Content& content, const ExtractLimits& limits) {
  CheckId3Size(fd, limits);
  // TagLib reads through a stream on a descriptor of its own; it decides the format from
  // the content, as the stream has no name to go by.
  int own = ::dup(fd);
  if (own < 0) throw ExtractError(std::string("dup: ") + std::strerror(errno));
  ::lseek(own, 0, SEEK_SET);
  TagLib::FileStream stream(own, true);  // closes own when it goes
  TagLib::FileRef file(&stream, true, TagLib::AudioProperties::Average);
  if (file.isNull() || file.tag() == nullptr) throw ExtractError("not an audio format TagLib reads");
  const TagLib::Tag* tag = file.tag();
  content.title = Utf8(tag->title().to8Bit(true), 1024);
  content.artist = Utf8(tag->artist().to8Bit(true), 1024);
  content.album = Utf8(tag->album().to8Bit(true), 1024);
  content.genre = Utf8(tag->genre().to8Bit(true), 256);
  content.year = tag->year();
  if (const TagLib::AudioProperties* properties = file.audioProperties())
    content.durationMs = properties->lengthInMilliseconds();
}

// ---------------------------------------------------------------------------- video

void ExtractVideo(const std::string& path, Content& content) {
  AVFormatContext* format = nullptr;
  AVDictionary* options = nullptr;
  // Enough to find the streams of any sane file; a file that needs more is not worth it.
  av_dict_set(&options, "probesize", "5000000", 0);
  av_dict_set(&options, "analyzeduration", "5000000", 0);
  int rc = avformat_open_input(&format, path.c_str(), nullptr, &options);
  av_dict_free(&options);
  if (rc < 0) {
    char message[AV_ERROR_MAX_STRING_SIZE] = {0};
    av_strerror(rc, message, sizeof(message));
    throw ExtractError(std::string("libavformat: ") + message);
  }
  std::unique_ptr<AVFormatContext*, void (*)(AVFormatContext**)> guard(&format, avformat_close_input);
  if (avformat_find_stream_info(format, nullptr) < 0)
    throw ExtractError("libavformat: no stream information");
  if (format->duration > 0 && format->duration != AV_NOPTS_VALUE)
    content.durationMs = format->duration / (AV_TIME_BASE / 1000);
  if (AVDictionaryEntry* title = av_dict_get(format->metadata, "title", nullptr, 0))
    content.title = Utf8(title->value, std::strlen(title->value), 1024);
  if (AVDictionaryEntry* artist = av_dict_get(format->metadata, "artist", nullptr, 0))
    content.artist = Utf8(artist->value, std::strlen(artist->value), 1024);
  bool hasVideo = false;
  for (unsigned i = 0; i < format->nb_streams; ++i) {
    const AVCodecParameters* codec = format->streams[i]->codecpar;
    if (codec->codec_type != AVMEDIA_TYPE_VIDEO && codec->codec_type != AVMEDIA_TYPE_AUDIO) continue;
    if (codec->codec_type == AVMEDIA_TYPE_VIDEO && !hasVideo &&
        !(format->streams[i]->disposition & AV_DISPOSITION_ATTACHED_PIC)) {
      hasVideo = true;
      content.width = codec->width;
      content.height = codec->height;
    }
    std::string name = avcodec_get_name(codec->codec_id);
    if (content.codecs.find(name) == std::string::npos && content.codecs.size() < 200)
      content.codecs += (content.codecs.empty() ? "" : ", ") + name;
  }
}

// ---------------------------------------------------------------------------- documents

void ExtractPlainText(int fd, Content& content, std::string& text, const ExtractLimits& limits) {
  std::string buffer(limits.maxText + 1, '\0');
  std::size_t have = 0;
  while (have < buffer.size()) {
    ssize_t n = ::pread(fd, &buffer[have], buffer.size() - have, static_cast<off_t>(have));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) throw ExtractError(std::string("read: ") + std::strerror(errno));
    if (n == 0) break;
    have += static_cast<std::size_t>(n);
  }
  content.textTruncated = have > limits.maxText;
  AppendUtf8(text, buffer.data(), std::min(have, limits.maxText), limits.maxText);
}

void QuietPoppler(const std::string&, void*) {}

std::string PopplerText(const poppler::ustring& text, std::size_t max = 4096) {
  poppler::byte_array bytes = text.to_utf8();
  return Utf8(bytes.data(), bytes.size(), max);
}

void ExtractPdf(const std::string& path, Content& content, std::string& text, const ExtractLimits& limits) {
  std::unique_ptr<poppler::document> document(poppler::document::load_from_file(path));
  if (!document) throw ExtractError("poppler cannot read it as a PDF");
  if (document->is_locked()) throw ExtractError("the PDF is encrypted");
  content.title = PopplerText(document->info_key("Title"), 1024);
  content.author = PopplerText(document->info_key("Author"), 1024);
  const int pages = document->pages();
  for (int i = 0; i < pages && i < limits.maxPages && text.size() < limits.maxText; ++i) {
    std::unique_ptr<poppler::page> page(document->create_page(i));
    if (!page) continue;
    poppler::byte_array bytes = page->text().to_utf8();
    if (!text.empty()) text += '\n';
    AppendUtf8(text, bytes.data(), bytes.size(), limits.maxText);
  }
  content.textTruncated = text.size() >= limits.maxText || pages > limits.maxPages;
}

// The text of an OpenDocument or Office Open XML member, by the character data of its XML.
struct XmlText {
  std::string* out;
  std::size_t max;
  int skip = 0;  // inside elements whose data is not text (field codes)
  // For metadata: the data of the first element with one of these local names.
  std::string wantTitle, wantAuthor;
  std::string* title = nullptr;
  std::string* author = nullptr;
  std::string* current = nullptr;
};

const char* LocalName(const char* name) {
  const char* colon = std::strrchr(name, ':');
  const char* space = std::strrchr(name, ' ');  // expat's "namespace name" form
  const char* last = colon > space ? colon : space;
  return last != nullptr ? last + 1 : name;
}

void XMLCALL XmlStart(void* data, const char* name, const char**) {
  auto* state = static_cast<XmlText*>(data);
  const char* local = LocalName(name);
  if (std::strcmp(local, "instrText") == 0 || std::strcmp(local, "delText") == 0) ++state->skip;
  if (state->title != nullptr && state->title->empty() && std::strcmp(local, "title") == 0)
    state->current = state->title;
  if (state->author != nullptr && state->author->empty() &&
      (std::strcmp(local, "creator") == 0 || std::strcmp(local, "initial-creator") == 0))
    state->current = state->author;
  if (std::strcmp(local, "tab") == 0 || std::strcmp(local, "s") == 0) *state->out += ' ';
}

void XMLCALL XmlEnd(void* data, const char* name) {
  auto* state = static_cast<XmlText*>(data);
  const char* local = LocalName(name);
  if (std::strcmp(local, "instrText") == 0 || std::strcmp(local, "delText") == 0) --state->skip;
  state->current = nullptr;
  // Paragraphs, headings, line breaks and cells end a run of words.
  if (std::strcmp(local, "p") == 0 || std::strcmp(local, "h") == 0 || std::strcmp(local, "br") == 0 ||
      std::strcmp(local, "line-break") == 0 || std::strcmp(local, "tc") == 0 ||
      std::strcmp(local, "si") == 0) {
    if (!state->out->empty() && state->out->back() != '\n' && state->out->size() < state->max)
      *state->out += '\n';
  }
}

void XMLCALL XmlData(void* data, const char* text, int length) {
  auto* state = static_cast<XmlText*>(data);
  if (state->current != nullptr) {
    AppendUtf8(*state->current, text, static_cast<std::size_t>(length), 1024);
    return;
  }
  if (state->skip == 0) AppendUtf8(*state->out, text, static_cast<std::size_t>(length), state->max);
}

struct ZipCloser {
  void operator()(zip_t* archive) const { zip_discard(archive); }
};

// Reads one member of the archive through expat; false when the member is absent.
bool ReadXmlMember(zip_t* archive, const std::string& member, XmlText& state, const ExtractLimits& limits) {
  zip_int64_t index = zip_name_locate(archive, member.c_str(), 0);
  if (index < 0) return false;
  zip_stat_t st;
  zip_stat_init(&st);
  if (zip_stat_index(archive, static_cast<zip_uint64_t>(index), 0, &st) != 0)
    throw ExtractError(member + ": " + zip_strerror(archive));
  if ((st.valid & ZIP_STAT_SIZE) && st.size > limits.maxArchiveMember)
    throw ExtractError(member + " unpacks to " + std::to_string(st.size >> 20) + " MiB, over the limit of " +
                       std::to_string(limits.maxArchiveMember >> 20) + " MiB");
  if ((st.valid & ZIP_STAT_SIZE) && (st.valid & ZIP_STAT_COMP_SIZE) && st.size > (8u << 20) &&
      st.size > st.comp_size * limits.maxCompressionRatio)
    throw ExtractError(member + " is packed " +
                       std::to_string(st.size / std::max<zip_uint64_t>(st.comp_size, 1)) +
                       " to 1: a zip bomb");
  std::unique_ptr<zip_file_t, int (*)(zip_file_t*)> file(
      zip_fopen_index(archive, static_cast<zip_uint64_t>(index), 0), zip_fclose);
  if (!file) throw ExtractError(member + ": " + zip_strerror(archive));
  std::unique_ptr<XML_ParserStruct, void (*)(XML_Parser)> parser(XML_ParserCreate("UTF-8"), XML_ParserFree);
  XML_SetUserData(parser.get(), &state);
  XML_SetElementHandler(parser.get(), XmlStart, XmlEnd);
  XML_SetCharacterDataHandler(parser.get(), XmlData);
  char buffer[65536];
  std::uint64_t total = 0;
  for (;;) {
    zip_int64_t n = zip_fread(file.get(), buffer, sizeof(buffer));
    if (n < 0) throw ExtractError(member + ": " + zip_file_strerror(file.get()));
    total += static_cast<std::uint64_t>(n);
    // The sizes in the archive's directory may lie; what is actually unpacked counts.
    if (total > limits.maxArchiveMember)
      throw ExtractError(member + " unpacks to more than " + std::to_string(limits.maxArchiveMember >> 20) +
                         " MiB");
    if (XML_Parse(parser.get(), buffer, static_cast<int>(n), n == 0) == XML_STATUS_ERROR)
      throw ExtractError(member + ": " + XML_ErrorString(XML_GetErrorCode(parser.get())) + " at line " +
                         std::to_string(XML_GetCurrentLineNumber(parser.get())));
    if (n == 0 || state.out->size() >= state.max) break;
  }
  return true;
}

void ExtractOfficeDocument(int fd, Content& content, std::string& text, const ExtractLimits& limits) {
  int own = ::dup(fd);
  if (own < 0) throw ExtractError(std::string("dup: ") + std::strerror(errno));
  ::lseek(own, 0, SEEK_SET);
  int error = 0;
  std::unique_ptr<zip_t, ZipCloser> archive(zip_fdopen(own, ZIP_RDONLY, &error));
  if (!archive) {
    ::close(own);
    zip_error_t reason;
    zip_error_init_with_code(&reason, error);
    std::string message = std::string("not a zip archive: ") + zip_error_strerror(&reason);
    zip_error_fini(&reason);
    throw ExtractError(message);
  }
  XmlText state;
  state.out = &text;
  state.max = limits.maxText;
  // libmagic names a zip by its first members; the members that hold the text say more.
  const char* type = nullptr;
  bool found = ReadXmlMember(archive.get(), "content.xml", state, limits);  // OpenDocument
  if (ReadXmlMember(archive.get(), "word/document.xml", state, limits)) {
    found = true;
    type = "application/vnd.openxmlformats-officedocument.wordprocessingml.document";
  }
  if (ReadXmlMember(archive.get(), "xl/sharedStrings.xml", state, limits)) {
    found = true;
    type = "application/vnd.openxmlformats-officedocument.spreadsheetml.sheet";
  }
  for (int slide = 1; slide <= 1000 && text.size() < limits.maxText; ++slide) {
    if (!ReadXmlMember(archive.get(), "ppt/slides/slide" + std::to_string(slide) + ".xml", state, limits))
      break;
    found = true;
    type = "application/vnd.openxmlformats-officedocument.presentationml.presentation";
  }
  if (!found) throw ExtractError("a zip archive without a document's text");
  if (content.mime == "application/zip" && type != nullptr) content.mime = type;
  content.textTruncated = text.size() >= limits.maxText;
  std::string discard;
  XmlText meta;
  meta.out = &discard;
  meta.max = 0;
  meta.title = &content.title;
  meta.author = &content.author;
  if (!ReadXmlMember(archive.get(), "meta.xml", meta, limits))
    ReadXmlMember(archive.get(), "docProps/core.xml", meta, limits);
}

bool IsOfficeMime(const std::string& mime) {
  return StartsWith(mime, "application/vnd.oasis.opendocument.") ||
         StartsWith(mime, "application/vnd.openxmlformats-officedocument.") || mime == "application/zip" ||
         mime == "application/epub+zip";
}

bool IsTextMime(const std::string& mime) {
  return StartsWith(mime, "text/") || mime == "application/json" || mime == "application/xml" ||
         mime == "application/csv" || mime == "application/x-subrip";
}

}  // namespace

Kind KindOfMime(const std::string& mime) {
  if (StartsWith(mime, "image/")) return Kind::kPhoto;
  if (StartsWith(mime, "audio/") || mime == "application/ogg") return Kind::kAudio;
  if (StartsWith(mime, "video/")) return Kind::kVideo;
  if (mime == "application/pdf" || IsTextMime(mime) ||
      StartsWith(mime, "application/vnd.oasis.opendocument.") ||
      StartsWith(mime, "application/vnd.openxmlformats-officedocument.") || mime == "application/msword" ||
      mime == "application/rtf" || mime == "application/epub+zip")
    return Kind::kDocument;
  return Kind::kOther;
}

bool InitExtractors(std::string& error) {
  g_magic = magic_open(MAGIC_MIME_TYPE | MAGIC_ERROR | MAGIC_NO_CHECK_COMPRESS);
  g_quickMagic = magic_open(MAGIC_MIME_TYPE | MAGIC_ERROR | MAGIC_NO_CHECK_COMPRESS | MAGIC_NO_CHECK_SOFT);
  for (magic_t handle : {g_magic, g_quickMagic}) {
    if (handle == nullptr || magic_load(handle, nullptr) != 0) {
      error = std::string("libmagic: ") + (handle != nullptr ? magic_error(handle) : std::strerror(errno));
      return false;
    }
  }
  Exiv2::LogMsg::setLevel(Exiv2::LogMsg::mute);
  av_log_set_level(AV_LOG_QUIET);
  poppler::set_debug_error_function(QuietPoppler, nullptr);
  return true;
}

void ExtractFile(const std::string& path, Kind hint, const ExtractLimits& limits, Content& content,
                 std::string& text) {
  content = Content();
  text.clear();
  // The file as it is now, never through a symbolic link and never a device or a pipe; the
  // libraries then read it by its descriptor's name, so a file swapped meanwhile is not read.
  int fd = ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY);
  if (fd < 0) {
    content.state = ExtractState::kFailed;
    content.reason = std::string("cannot open: ") + std::strerror(errno);
    return;
  }
  struct stat st;
  std::unique_ptr<int, void (*)(int*)> closer(&fd, [](int* descriptor) { ::close(*descriptor); });
  if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    content.state = ExtractState::kSkipped;
    content.reason = "not a regular file";
    return;
  }
  const std::string byDescriptor = "/proc/self/fd/" + std::to_string(fd);
  try {
    const char* mime = nullptr;
    if (hint == Kind::kOther) {
      // A name that says nothing: most such files are of no kind, so their type is told
      // from their first bytes only (libmagic would otherwise read up to megabytes).
      char head[kSniffBytes];
      ssize_t n;
      while ((n = ::pread(fd, head, sizeof(head), 0)) < 0 && errno == EINTR) {
      }
      if (n < 0) throw ExtractError(std::string("read: ") + std::strerror(errno));
      mime = magic_buffer(g_magic, head, static_cast<std::size_t>(n));
    } else if (hint == Kind::kDocument && TextExtension(path)) {
      mime = magic_descriptor(g_quickMagic, fd);
      if (mime != nullptr && !StartsWith(mime, "text/")) mime = nullptr;
      ::lseek(fd, 0, SEEK_SET);
    }
    if (mime == nullptr) mime = magic_descriptor(g_magic, fd);
    content.mime = mime != nullptr ? mime : "application/octet-stream";
    ::lseek(fd, 0, SEEK_SET);
    if (content.mime == "inode/x-empty" || st.st_size == 0) {
      content.kind = hint;
      return;  // nothing inside to extract
    }
    Kind kind = KindOfMime(content.mime);
    if (kind == Kind::kOther) kind = hint;  // the type says nothing more: trust the name
    // Text without a name saying so is a document when it is prose; source code, scripts
    // and configuration files are not.
    if (hint == Kind::kOther && kind == Kind::kDocument && IsTextMime(content.mime) &&
        content.mime != "text/plain")
      kind = Kind::kOther;
    content.kind = kind;
    switch (kind) {
      case Kind::kPhoto:
        ExtractPhoto(byDescriptor, content);
        break;
      case Kind::kAudio:
        ExtractAudio(fd, content, limits);
        break;
      case Kind::kVideo:
        ExtractVideo(byDescriptor, content);
        break;
      case Kind::kDocument:
        if (content.mime == "application/pdf") {
          ExtractPdf(byDescriptor, content, text, limits);
        } else if (IsOfficeMime(content.mime)) {
          ExtractOfficeDocument(fd, content, text, limits);
        } else if (IsTextMime(content.mime)) {
          ExtractPlainText(fd, content, text, limits);
        } else {
          content.state = ExtractState::kSkipped;
          content.reason = "no text extractor for " + content.mime;
        }
        break;
      case Kind::kOther:
        content.state = ExtractState::kSkipped;
        content.reason = "nothing to extract from " + content.mime;
        break;
    }
  } catch (const ExtractError& error) {
    content.state = ExtractState::kFailed;
    content.reason = Utf8(error.what(), std::strlen(error.what()), 1024);
  } catch (const std::bad_alloc&) {
    content.state = ExtractState::kFailed;
    content.reason = "out of memory (over the worker's memory limit)";
  } catch (const std::exception& error) {
    content.state = ExtractState::kFailed;
    content.reason = Utf8(error.what(), std::strlen(error.what()), 1024);
  }
  if (content.state == ExtractState::kFailed && hint == Kind::kOther && content.kind != Kind::kOther) {
    // Some types are told by weak signatures that random bytes match too: a file whose
    // name says nothing and which is not what its first bytes suggest is no failed photo.
    content.state = ExtractState::kSkipped;
    content.kind = Kind::kOther;
    content.reason = "taken for " + content.mime + ", but: " + content.reason;
  }
  if (content.state != ExtractState::kDone) text.clear();
}

}  // namespace fileindexd
