// fileindex-samples SHARES: writes files with contents into the sandbox's shares (SHARES is
// the directory holding volume1 and volume2): photos with EXIF in photo/2020/trip, tagged
// songs in music/albums/Low Tide, a video in video/movies and documents in photo/2020/trip.
#include <cstdio>
#include <filesystem>
#include <string>

#include "content_samples.h"

int main(int argc, char** argv) {
  if (argc != 2) {
    std::fprintf(stderr, "usage: fileindex-samples SANDBOX\n");
    return 2;
  }
  namespace cs = content_samples;
  namespace fs = std::filesystem;
  const std::string root = argv[1];
  const std::string trip = root + "/volume1/photo/2020/trip";
  const std::string album = root + "/volume2/music/albums/Low Tide";
  const std::string movies = root + "/volume1/video/movies";
  for (const std::string& dir : {trip, album, movies}) fs::create_directories(dir);
  bool ok = true;

  cs::Exif harbour;
  harbour.taken = "2020:07:14 10:11:12";
  ok = ok && cs::WritePhoto(trip + "/IMG_0412.jpg", harbour, 640, 480);
  cs::Exif cliff;
  cliff.taken = "2020:08:02 19:45:03";
  cliff.make = "Osprey";
  cliff.model = "O2 Mark II";
  cliff.latitude = 60.3913;
  cliff.longitude = 5.3221;
  ok = ok && cs::WritePhoto(trip + "/IMG_0977.jpg", cliff, 800, 600);

  const char* titles[] = {"Harbour Lights", "Salt Wind", "Ferry at Dawn"};
  for (int i = 0; i < 3; ++i) {
    cs::Tags tags;
    tags.title = titles[i];
    ok =
        ok && cs::WriteAudio(album + "/0" + std::to_string(i + 1) + (i == 2 ? ".flac" : ".mp3"), tags, 2 + i);
  }
  ok = ok && cs::WriteVideo(movies + "/VID_2020.mkv", "Lighthouse at dusk", 75, 320, 240);

  cs::Write(trip + "/itinerary.pdf",
            cs::Pdf({"Day 1: the ferry to the puffin colony", "Day 2: the lighthouse and the cliffs"},
                    "Island itinerary"));
  ok = ok && cs::WriteDocx(trip + "/packing.docx", {"Packing list", "binoculars, rain coat, field guide"});
  ok = ok && cs::WriteOdt(trip + "/diary.odt", {"We counted forty guillemots on the ledge."});
  // And one photo cut short, as a failed copy leaves it.
  const std::string whole = trip + "/IMG_0412.jpg";
  std::ifstream in(whole, std::ios::binary);
  std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  cs::Write(trip + "/IMG_0413.jpg", bytes.substr(0, bytes.find(std::string("Exif\0\0", 6)) + 60));
  if (!ok) std::fprintf(stderr, "fileindex-samples: some files could not be written\n");
  return ok ? 0 : 1;
}
