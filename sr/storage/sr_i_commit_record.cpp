// sr_i_commit_record.cpp - building and reading the commit record (its
// layout is in sr_i_commit_record.h). A record read from a file is checked
// against its own lengths before anything in it is trusted.

#include "storage/sr_i_commit_record.h"

#include <cstring>
#include <new>

#include "frame/sr_i_errors.h"

namespace {

constexpr uint32_t Header_Length = 12;
constexpr uint32_t Counter_Body_Length = 8;
constexpr uint32_t Element_Header_Length = 8;

void put_word(std::vector<unsigned char> &record, uint32_t word) {
  const auto *p_bytes = reinterpret_cast<const unsigned char *>(&word);
  record.insert(record.end(), p_bytes, p_bytes + sizeof word);
}

uint32_t word_at(std::span<const unsigned char> record, size_t offset) {
  uint32_t word;
  std::memcpy(&word, record.data() + offset, sizeof word);
  return word;
}

// The value an element contributes: its newest one.
const qv_binary_t *value_of(const sr_i_application_metadata_index_element_t &element) {
  return element.p_applied != nullptr ? element.p_applied : element.p_committed;
}

}  // namespace

const uint32_t Sr_Commit_Record_Padding[3] = {Sr_Commit_Record_Padding_Length, 0, 0};

int32_t sr_i_create_commit_record(const sr_i_application_metadata_t *p_application_metadata,
                                  uint64_t change_counter, std::vector<unsigned char> &record) {
  uint32_t elements = 0;
  uint32_t element_bytes = 0;
  const uint32_t total =
      p_application_metadata != nullptr ? p_application_metadata->total_elements : 0;
  for (uint32_t at = 0; at < total; ++at) {
    if (const qv_binary_t *p_value = value_of(p_application_metadata->p_index[at])) {
      ++elements;
      element_bytes += Element_Header_Length + p_value->length;
    }
  }
  const uint32_t metadata_bytes = elements > 0 ? element_bytes + 4 : 0;
  const uint32_t body_length = Counter_Body_Length + metadata_bytes;
  try {
    record.clear();
    record.reserve(Header_Length + 4 + body_length);
    put_word(record, Header_Length + 4 + body_length);
    put_word(record, 0);
    put_word(record, Sr_Live_Commit_Record);
    put_word(record, body_length);
    const auto *p_counter = reinterpret_cast<const unsigned char *>(&change_counter);
    record.insert(record.end(), p_counter, p_counter + sizeof change_counter);
    if (elements > 0) {
      put_word(record, elements);
      for (uint32_t at = 0; at < total; ++at) {
        const sr_i_application_metadata_index_element_t &element =
            p_application_metadata->p_index[at];
        if (const qv_binary_t *p_value = value_of(element)) {
          put_word(record, element.type);
          put_word(record, p_value->length);
          record.insert(record.end(), p_value->data, p_value->data + p_value->length);
        }
      }
    }
  } catch (const std::bad_alloc &) {
    return sr_i_raise_no_memory();
  }
  return 0;
}

int32_t sr_i_open_commit_record(std::span<const unsigned char> record,
                                sr_i_application_metadata_t *p_application_metadata,
                                uint64_t *p_change_counter) {
  if (record.size() < Sr_Empty_Commit_Record_Length || word_at(record, 0) != record.size() ||
      size_t{word_at(record, Header_Length)} + Header_Length + 4 != record.size()) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  uint64_t change_counter;
  std::memcpy(&change_counter, record.data() + 16, sizeof change_counter);
  if (record.size() > Sr_Empty_Commit_Record_Length) {
    if (record.size() < Sr_Empty_Commit_Record_Length + 4) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    const uint32_t elements = word_at(record, Sr_Empty_Commit_Record_Length);
    size_t offset = Sr_Empty_Commit_Record_Length + 4;
    for (uint32_t element = 0; element < elements; ++element) {
      if (record.size() - offset < Element_Header_Length ||
          record.size() - offset - Element_Header_Length < word_at(record, offset + 4)) {
        sr_i_abort_application_metadata_buffer_updates(p_application_metadata);
        return sr_i_raise(SR_E_TABLE_UNREADABLE);
      }
      const uint32_t type = word_at(record, offset);
      const uint32_t length = word_at(record, offset + 4);
      const int32_t rc = sr_i_add_application_metadata_element(
          p_application_metadata, type, length, record.data() + offset + Element_Header_Length);
      if (rc != 0) {
        sr_i_abort_application_metadata_buffer_updates(p_application_metadata);
        // Two elements of one type: the record was not written by us.
        return rc == SR_E_DUPLICATE_KEY ? sr_i_raise(SR_E_TABLE_UNREADABLE) : rc;
      }
      offset += Element_Header_Length + length;
    }
    if (offset != record.size()) {
      sr_i_abort_application_metadata_buffer_updates(p_application_metadata);
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    sr_i_commit_application_metadata_buffer_updates(p_application_metadata);
  }
  *p_change_counter = change_counter;
  return 0;
}
