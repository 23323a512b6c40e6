// A listening socket of the Linux transport: accepts connections on the loop and hands
// each, not yet resumed, to the listener's handler.
#pragma once

#include <sys/types.h>

#include <memory>
#include <string>

#include "base/runloop.h"
#include "platform/ipc_service.h"
#include "platform/linux/ipc_connection.h"
#include "base/unique_fd.h"

namespace brisvale::ipc {

class LinuxListener : public Listener {
 public:
  // `ownedPath`, when not empty, is the socket file this listener bound; it is removed
  // when the listener goes, unless another socket has replaced it meanwhile.
  LinuxListener(std::shared_ptr<TransportContext> context, UniqueFd socket, std::string ownedPath);
  ~LinuxListener() override;

  void Resume(Handler handler) override;

 private:
  void AcceptReady();
  // Out of descriptors: the one held in reserve makes room to take the waiting
  // connection off the queue and close it, so the listener never stalls.
  void ShedOneConnection();
  bool Admit(const LinuxConnection& connection) const;

  std::shared_ptr<TransportContext> context_;
  UniqueFd socket_;
  std::string ownedPath_;
  ino_t ownedInode_ = 0;
  Handler handler_;
  SourceHandle source_;
  UniqueFd reserve_;
  std::shared_ptr<bool> alive_ = std::make_shared<bool>(true);
};

}  // namespace brisvale::ipc
