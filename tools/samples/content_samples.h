// Files of each kind the extraction worker reads, made on the spot with the libraries of
// their formats (and a PDF and zip documents written by hand), plus hostile ones: for the
// sample maker, the service test and the benchmark.
#ifndef FILEINDEX_SAMPLES_CONTENT_SAMPLES_H
#define FILEINDEX_SAMPLES_CONTENT_SAMPLES_H

#include <taglib/fileref.h>
#include <taglib/opusfile.h>
#include <taglib/tag.h>
#include <zip.h>

#include <algorithm>
#include <cstdint>
#include <exiv2/exiv2.hpp>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <utility>
#include <vector>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/imgutils.h>
}

namespace content_samples {

inline void Write(const std::string& path, const std::string& bytes) {
  std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
}

// A grey-gradient picture of width x height, as JPEG (by libavcodec's encoder).
inline std::string Jpeg(int width, int height) {
  const AVCodec* codec = avcodec_find_encoder(AV_CODEC_ID_MJPEG);
  if (codec == nullptr) return "";
  AVCodecContext* context = avcodec_alloc_context3(codec);
  context->width = width;
  context->height = height;
  context->pix_fmt = AV_PIX_FMT_YUVJ420P;
  context->time_base = AVRational{1, 25};
  std::string jpeg;
  if (avcodec_open2(context, codec, nullptr) == 0) {
    AVFrame* frame = av_frame_alloc();
    frame->format = context->pix_fmt;
    frame->width = width;
    frame->height = height;
    av_frame_get_buffer(frame, 0);
    for (int plane = 0; plane < 3; ++plane) {
      int w = plane == 0 ? width : (width + 1) / 2, h = plane == 0 ? height : (height + 1) / 2;
      for (int y = 0; y < h; ++y)
        for (int x = 0; x < w; ++x)
          frame->data[plane][y * frame->linesize[plane] + x] = static_cast<std::uint8_t>(plane ? 128 : x + y);
    }
    AVPacket* packet = av_packet_alloc();
    if (avcodec_send_frame(context, frame) == 0 && avcodec_send_frame(context, nullptr) == 0 &&
        avcodec_receive_packet(context, packet) == 0)
      jpeg.assign(reinterpret_cast<const char*>(packet->data), static_cast<std::size_t>(packet->size));
    av_packet_free(&packet);
    av_frame_free(&frame);
  }
  avcodec_free_context(&context);
  return jpeg;
}

struct Exif {
  std::string taken = "2019:07:14 10:11:12", make = "Kestrel", model = "K-100";
  double latitude = 48.8583, longitude = -2.2945;  // south-west is negative
};

// A JPEG with EXIF written by Exiv2.
inline bool WritePhoto(const std::string& path, const Exif& exif, int width = 32, int height = 24) {
  Write(path, Jpeg(width, height));
  try {
    auto image = Exiv2::ImageFactory::open(path);
    image->readMetadata();
    Exiv2::ExifData& data = image->exifData();
    data["Exif.Photo.DateTimeOriginal"] = exif.taken;
    data["Exif.Image.Make"] = exif.make;
    data["Exif.Image.Model"] = exif.model;
    auto dms = [](double value) {
      value = value < 0 ? -value : value;
      int degrees = static_cast<int>(value);
      int minutes = static_cast<int>((value - degrees) * 60);
      int seconds100 = static_cast<int>(((value - degrees) * 60 - minutes) * 6000);
      return std::to_string(degrees) + "/1 " + std::to_string(minutes) + "/1 " + std::to_string(seconds100) +
             "/100";
    };
    Exiv2::URationalValue latitude, longitude;
    latitude.read(dms(exif.latitude));
    longitude.read(dms(exif.longitude));
    data["Exif.GPSInfo.GPSLatitude"] = latitude;
    data["Exif.GPSInfo.GPSLatitudeRef"] = exif.latitude < 0 ? "S" : "N";
    data["Exif.GPSInfo.GPSLongitude"] = longitude;
    data["Exif.GPSInfo.GPSLongitudeRef"] = exif.longitude < 0 ? "W" : "E";
    image->writeMetadata();
    return true;
  } catch (const Exiv2::AnyError&) {
    return false;
  }
}

struct Tags {
  std::string title = "Harbour Lights", artist = "The Gulls", album = "Low Tide", genre = "Folk";
  unsigned year = 2011;
};

// MPEG-1 layer III frames of silence (128 kbit/s, 44.1 kHz): about `seconds` long.
inline std::string Mp3Frames(double seconds) {
  const std::string frame =
      std::string("\xFF\xFB\x90\x64", 4) + std::string(417 - 4, '\0');  // 144 * 128000 / 44100
  std::string out;
  for (int i = 0; i < static_cast<int>(seconds * 44100 / 1152); ++i) out += frame;
  return out;
}

// A FLAC stream with its STREAMINFO block only (44.1 kHz, 16 bits, stereo, `seconds` long).
inline std::string FlacHeader(double seconds) {
  std::string out = "fLaC";
  out += '\x80';  // last metadata block, type 0 (STREAMINFO)
  out += std::string("\x00\x00\x22", 3);
  std::string info(34, '\0');
  info[0] = 0x10, info[1] = 0x00, info[2] = 0x10, info[3] = 0x00;  // block sizes 4096
  std::uint64_t samples = static_cast<std::uint64_t>(seconds * 44100);
  std::uint64_t packed =
      (std::uint64_t(44100) << 44) | (std::uint64_t(1) << 41) | (std::uint64_t(15) << 36) | samples;
  for (int i = 0; i < 8; ++i) info[10 + i] = static_cast<char>((packed >> (56 - 8 * i)) & 0xFF);
  return out + info;
}

// The Ogg page checksum: CRC-32 with polynomial 0x04C11DB7, most significant bit first, no
// reflection, starting from 0, over the page with its checksum field zero.
inline std::uint32_t OggCrc(const std::string& page) {
  std::uint32_t crc = 0;
  for (unsigned char byte : page) {
    crc ^= static_cast<std::uint32_t>(byte) << 24;
    for (int bit = 0; bit < 8; ++bit) crc = crc & 0x80000000u ? (crc << 1) ^ 0x04C11DB7u : crc << 1;
  }
  return crc;
}

inline void PutLe(std::string& out, std::uint64_t value, int bytes) {
  for (int i = 0; i < bytes; ++i) out += static_cast<char>((value >> (8 * i)) & 0xFF);
}

// One Ogg page of the stream holding whole packets (at most 255 lacing values).
inline std::string OggPage(int flags, std::uint64_t granule, std::uint32_t sequence,
                           const std::vector<std::string>& packets) {
  std::string lacing, body;
  for (const std::string& packet : packets) {
    for (std::size_t left = packet.size();; left -= 255) {
      lacing += static_cast<char>(left < 255 ? left : 255);
      if (left < 255) break;
    }
    body += packet;
  }
  std::string page = "OggS";
  page += '\0';
  page += static_cast<char>(flags);
  PutLe(page, granule, 8);
  PutLe(page, 0x0F1E2D3C, 4);  // the stream's serial number
  PutLe(page, sequence, 4);
  PutLe(page, 0, 4);  // the checksum, filled in below
  page += static_cast<char>(lacing.size());
  page += lacing + body;
  const std::uint32_t crc = OggCrc(page);
  for (int i = 0; i < 4; ++i) page[22 + i] = static_cast<char>((crc >> (8 * i)) & 0xFF);
  return page;
}

// An Ogg Opus stream (mono, 48 kHz) of `seconds` of 20 ms packets, each an empty frame
// (which a decoder plays as silence); its last page's granule position makes it exactly
// that long. The tags are empty: TagLib writes them.
inline std::string OggOpus(double seconds) {
  const std::uint16_t preSkip = 312;
  std::string head = "OpusHead";
  head += '\1';  // version
  head += '\1';  // channels
  PutLe(head, preSkip, 2);
  PutLe(head, 48000, 4);  // the input's sample rate
  PutLe(head, 0, 2);      // output gain
  head += '\0';           // channel mapping family
  std::string tags = "OpusTags";
  PutLe(tags, 6, 4);
  tags += "sample";
  PutLe(tags, 0, 4);  // no comments
  std::string out = OggPage(0x02, 0, 0, {head}) + OggPage(0, 0, 1, {tags});
  const std::uint64_t samples = static_cast<std::uint64_t>(seconds * 48000);
  const std::uint64_t packets = (samples + 959) / 960;
  const std::string packet(1, '\xF8');  // CELT fullband 20 ms, mono, one frame
  std::uint32_t sequence = 2;
  for (std::uint64_t sent = 0; sent < packets;) {
    const std::uint64_t now = std::min<std::uint64_t>(255, packets - sent);
    sent += now;
    const bool last = sent == packets;
    out += OggPage(last ? 0x04 : 0, preSkip + (last ? samples : sent * 960), sequence++,
                   std::vector<std::string>(now, packet));
  }
  return out;
}

// An MP3, FLAC or Ogg Opus (.ogg, .opus) file, by its extension, with tags written by TagLib.
inline bool WriteAudio(const std::string& path, const Tags& tags, double seconds = 3) {
  const std::string extension = std::filesystem::path(path).extension();
  const bool opus = extension == ".ogg" || extension == ".opus";
  Write(path, extension == ".flac" ? FlacHeader(seconds) : opus ? OggOpus(seconds) : Mp3Frames(seconds));
  std::unique_ptr<TagLib::File> opened;
  if (opus) opened.reset(new TagLib::Ogg::Opus::File(path.c_str()));
  TagLib::FileRef file = opened ? TagLib::FileRef(opened.release()) : TagLib::FileRef(path.c_str());
  if (file.isNull() || file.tag() == nullptr) return false;
  file.tag()->setTitle(TagLib::String(tags.title, TagLib::String::UTF8));
  file.tag()->setArtist(TagLib::String(tags.artist, TagLib::String::UTF8));
  file.tag()->setAlbum(TagLib::String(tags.album, TagLib::String::UTF8));
  file.tag()->setGenre(TagLib::String(tags.genre, TagLib::String::UTF8));
  file.tag()->setYear(tags.year);
  return file.save();
}

// A Matroska file of `frames` MJPEG frames (25 per second), muxed by libavformat.
inline bool WriteVideo(const std::string& path, const std::string& title, int frames = 25, int width = 64,
                       int height = 48) {
  AVFormatContext* format = nullptr;
  if (avformat_alloc_output_context2(&format, nullptr, "matroska", path.c_str()) < 0) return false;
  AVStream* stream = avformat_new_stream(format, nullptr);
  stream->codecpar->codec_type = AVMEDIA_TYPE_VIDEO;
  stream->codecpar->codec_id = AV_CODEC_ID_MJPEG;
  stream->codecpar->width = width;
  stream->codecpar->height = height;
  stream->time_base = AVRational{1, 25};
  av_dict_set(&format->metadata, "title", title.c_str(), 0);
  bool ok = avio_open(&format->pb, path.c_str(), AVIO_FLAG_WRITE) >= 0 &&
            avformat_write_header(format, nullptr) >= 0;
  const std::string jpeg = Jpeg(width, height);
  for (int i = 0; ok && i < frames; ++i) {
    AVPacket* packet = av_packet_alloc();
    av_new_packet(packet, static_cast<int>(jpeg.size()));
    std::copy(jpeg.begin(), jpeg.end(), packet->data);
    packet->stream_index = stream->index;
    packet->pts = packet->dts = av_rescale_q(i, AVRational{1, 25}, stream->time_base);
    packet->duration = av_rescale_q(1, AVRational{1, 25}, stream->time_base);
    packet->flags |= AV_PKT_FLAG_KEY;
    ok = av_interleaved_write_frame(format, packet) >= 0;
    av_packet_free(&packet);
  }
  ok = ok && av_write_trailer(format) >= 0;
  if (format->pb != nullptr) avio_closep(&format->pb);
  avformat_free_context(format);
  return ok;
}

// A PDF of one page per text, each shown in Helvetica; the cross-reference table has the
// objects' true offsets.
inline std::string Pdf(const std::vector<std::string>& pages, const std::string& title = "") {
  std::vector<std::string> objects;
  std::string kids;
  const int firstPage = 4;
  for (std::size_t i = 0; i < pages.size(); ++i) kids += std::to_string(firstPage + 2 * i) + " 0 R ";
  objects.push_back("<< /Type /Catalog /Pages 2 0 R >>");
  objects.push_back("<< /Type /Pages /Kids [" + kids + "] /Count " + std::to_string(pages.size()) + " >>");
  objects.push_back("<< /Type /Font /Subtype /Type1 /BaseFont /Helvetica >>");
  for (std::size_t i = 0; i < pages.size(); ++i) {
    std::string stream = "BT /F1 12 Tf 72 720 Td (" + pages[i] + ") Tj ET";
    objects.push_back(
        "<< /Type /Page /Parent 2 0 R /MediaBox [0 0 612 792] /Resources << /Font << /F1 3 0 R >> >>"
        " /Contents " +
        std::to_string(firstPage + 2 * i + 1) + " 0 R >>");
    objects.push_back("<< /Length " + std::to_string(stream.size()) + " >>\nstream\n" + stream +
                      "\nendstream");
  }
  if (!title.empty()) objects.push_back("<< /Title (" + title + ") >>");
  std::string out = "%PDF-1.4\n";
  std::vector<std::size_t> offsets;
  for (std::size_t i = 0; i < objects.size(); ++i) {
    offsets.push_back(out.size());
    out += std::to_string(i + 1) + " 0 obj\n" + objects[i] + "\nendobj\n";
  }
  const std::size_t xref = out.size();
  out += "xref\n0 " + std::to_string(objects.size() + 1) + "\n0000000000 65535 f \n";
  for (std::size_t offset : offsets) {
    char line[32];
    std::snprintf(line, sizeof(line), "%010zu 00000 n \n", offset);
    out += line;
  }
  out += "trailer\n<< /Size " + std::to_string(objects.size() + 1) + " /Root 1 0 R" +
         (title.empty() ? "" : " /Info " + std::to_string(objects.size()) + " 0 R") + " >>\nstartxref\n" +
         std::to_string(xref) + "\n%%EOF\n";
  return out;
}

// A zip archive of (name, content) members; `level` 0 stores them, 9 packs them hardest.
inline bool WriteZip(const std::string& path, const std::vector<std::pair<std::string, std::string>>& members,
                     int level = 6) {
  int error = 0;
  zip_t* archive = zip_open(path.c_str(), ZIP_CREATE | ZIP_TRUNCATE, &error);
  if (archive == nullptr) return false;
  for (const auto& member : members) {
    zip_source_t* source = zip_source_buffer(archive, member.second.data(), member.second.size(), 0);
    zip_int64_t index = zip_file_add(archive, member.first.c_str(), source, ZIP_FL_OVERWRITE);
    if (index < 0) {
      zip_source_free(source);
      zip_discard(archive);
      return false;
    }
    zip_set_file_compression(archive, static_cast<zip_uint64_t>(index),
                             level == 0 ? ZIP_CM_STORE : ZIP_CM_DEFLATE, static_cast<zip_uint32_t>(level));
  }
  return zip_close(archive) == 0;
}

inline bool WriteDocx(const std::string& path, const std::vector<std::string>& paragraphs) {
  std::string body;
  for (const std::string& paragraph : paragraphs)
    body += "<w:p><w:r><w:t>" + paragraph + "</w:t></w:r></w:p>";
  return WriteZip(path,
                  {{"[Content_Types].xml",
                    "<?xml version=\"1.0\"?><Types xmlns=\"http://schemas.openxmlformats.org/package/2006/"
                    "content-types\"><Override PartName=\"/word/document.xml\" ContentType=\"application/"
                    "vnd.openxmlformats-officedocument.wordprocessingml.document.main+xml\"/></Types>"},
                   {"word/document.xml",
                    "<?xml version=\"1.0\"?><w:document xmlns:w=\"http://schemas.openxmlformats.org/"
                    "wordprocessingml/2006/main\"><w:body>" +
                        body + "</w:body></w:document>"}});
}

inline bool WriteOdt(const std::string& path, const std::vector<std::string>& paragraphs) {
  std::string body;
  for (const std::string& paragraph : paragraphs) body += "<text:p>" + paragraph + "</text:p>";
  return WriteZip(
      path,
      {{"mimetype", "application/vnd.oasis.opendocument.text"},
       {"content.xml",
        "<?xml version=\"1.0\"?><office:document-content xmlns:office=\"urn:oasis:names:tc:"
        "opendocument:xmlns:office:1.0\" xmlns:text=\"urn:oasis:names:tc:opendocument:xmlns:text:1.0\">"
        "<office:body><office:text>" +
            body + "</office:text></office:body></office:document-content>"}},
      0);
}

}  // namespace content_samples

#endif
