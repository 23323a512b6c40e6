// DERDecodeItem, iteration and DERParseSequence over arbitrary bytes.
#include <cstddef>
#include <cstdint>

#include "verify/der/der.h"
#include "verify/der/der_item_specs.h"

using namespace brisvale;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > UINT32_MAX) return 0;
  const DERItem input = {data, static_cast<uint32_t>(size)};
  DERDecodedItem item;
  DERDecodeItem(&input, &item);
  DERDecodeItemPartialBuffer(&input, &item, true);

  // Walk nested constructed elements two levels deep.
  DERTag tag;
  DERSequence outer;
  if (DERDecodeSeqInit(&input, &tag, &outer) == DERResultSuccess) {
    DERDecodedItem element;
    while (DERDecodeSeqNext(&outer, &element) == DERResultSuccess) {
      DERSequence inner;
      DERDecodeSeqContentInit(&element.content, &inner);
      DERDecodedItem child;
      while (DERDecodeSeqNext(&inner, &child) == DERResultSuccess) {
        uint64_t number;
        bool flag;
        DERItem bits;
        uint8_t unused;
        DERParseInteger64(&child.content, &number);
        DERParseBoolean(&child.content, &flag);
        DERParseBitString(&child.content, &bits, &unused);
      }
    }
  }

  // The certificate tables, each feeding the next as a chain verifier would.
  DERSignedCertCrl signedCert;
  if (DERParseSequence(&input, DERNumSignedCertCrlItemSpecs, DERSignedCertCrlItemSpecs,
                       &signedCert, sizeof signedCert) != DERResultSuccess) {
    return 0;
  }
  DERTBSCert tbs;
  if (DERParseSequence(&signedCert.tbs, DERNumTBSCertItemSpecs, DERTBSCertItemSpecs, &tbs,
                       sizeof tbs) != DERResultSuccess) {
    return 0;
  }
  DERSubjPubKeyInfo keyInfo;
  DERAlgorithmId algorithm;
  if (DERParseSequenceContent(&tbs.subjectPubKey, DERNumSubjPubKeyInfoItemSpecs,
                              DERSubjPubKeyInfoItemSpecs, &keyInfo, sizeof keyInfo) == 0) {
    DERParseSequenceContent(&keyInfo.algId, DERNumAlgorithmIdItemSpecs, DERAlgorithmIdItemSpecs,
                            &algorithm, sizeof algorithm);
  }
  DERSequence extensions;
  if (tbs.extensions.data != nullptr &&
      DERDecodeSeqInit(&tbs.extensions, &tag, &extensions) == DERResultSuccess) {
    DERDecodedItem element;
    while (DERDecodeSeqNext(&extensions, &element) == DERResultSuccess) {
      DERExtension extension;
      DERParseSequenceContent(&element.content, DERNumExtensionItemSpecs, DERExtensionItemSpecs,
                              &extension, sizeof extension);
    }
  }
  return 0;
}
