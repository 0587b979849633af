#pragma once
// One connection to a card through pcscd: the PC/SC context, the chosen
// reader and the card handle. Not thread-safe: the vendor functions hold
// their lock around every call.
#include <winscard.h>

#include <cstdint>
#include <string>
#include <vector>

namespace ese_pcsc {

extern const char* const kTag;

class PcscLink {
 public:
  PcscLink() = default;
  ~PcscLink();
  PcscLink(const PcscLink&) = delete;
  PcscLink& operator=(const PcscLink&) = delete;

  // Connects to the first reader whose name contains `wanted` and holds a
  // card ("" : the first reader that holds a card), T=0 or T=1 as the card
  // offers. Keeps a live connection that still matches. Logs why it fails:
  // no pcscd, no reader, no card.
  bool open(const std::string& wanted);
  // Disconnects powering the card down, so every logical channel is gone.
  void close();
  bool isOpen() const { return connected_; }

  // The card is there and powered under our handle; a card reset by another
  // application is reconnected (its logical channels are gone either way).
  bool ready();

  // One APDU; the whole response (data, SW1 SW2) in *resp. A card or
  // reader gone ends the connection: the next open connects again.
  bool transmit(const char* who, const uint8_t* cmd, size_t len, std::vector<uint8_t>* resp);

  const std::string& reader() const { return reader_; }
  DWORD protocol() const { return protocol_; }

 private:
  bool establish(const char* who);
  bool chooseReader(const std::string& wanted, std::string* chosen);
  bool connect(const std::string& name);
  bool alive();
  void drop(const char* who, LONG rv);
  void release();

  SCARDCONTEXT context_ = 0;
  bool haveContext_ = false;
  SCARDHANDLE card_ = 0;
  bool connected_ = false;
  DWORD protocol_ = 0;
  std::string reader_;
  std::vector<uint8_t> rxBuffer_;
};

}  // namespace ese_pcsc
