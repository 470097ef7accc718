// One platform audio converter: its stream descriptions, its properties, and every
// platform status turned into an eConverterErrorCode. Base of the AAC codecs.
#pragma once

#include <AudioToolbox/AudioToolbox.h>

#include "codec/ACFormat.h"
#include "codec/eConverterErrorCode.h"

class AudioConverterBase {
public:
    AudioConverterBase();
    virtual ~AudioConverterBase();
    AudioConverterBase(const AudioConverterBase&) = delete;
    AudioConverterBase& operator=(const AudioConverterBase&) = delete;

    // Builds a converter from `input` to `output` and reads back the descriptions it settled on.
    virtual eConverterErrorCode Initialize(const ACFormat& input, const ACFormat& output);
    virtual void Close();
    virtual eConverterErrorCode CreateConverter(const AudioStreamBasicDescription& input,
                                                const AudioStreamBasicDescription& output);
    virtual void CloseConverter();
    virtual eConverterErrorCode GetACProperty(unsigned int propertyID, unsigned int* propertySize,
                                              void* propertyData) const;
    virtual eConverterErrorCode SetACProperty(unsigned int propertyID, unsigned int propertySize,
                                              void* propertyData);
    virtual void ACFormat2BasicDescription(const ACFormat& format, AudioStreamBasicDescription& description) const;
    virtual void BasicDescription2ACFormat(const AudioStreamBasicDescription& description, ACFormat& format) const;
    virtual void GetInputFormat(ACFormat& format) const;
    virtual void GetOutputFormat(ACFormat& format) const;

protected:
    AudioConverterRef m_converter;
    AudioStreamBasicDescription m_inputDescription;
    AudioStreamBasicDescription m_outputDescription;
};

eConverterErrorCode ConvertACError(int status);
